// What a component said through a callback, from any of its threads: the lines in the order they
// came.
#pragma once

#include <algorithm>
#include <functional>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

namespace qv::test {

class Notes {
  public:
    // A callback that notes each line it is given.
    std::function<void(const std::string&)> callback() {
        return [this](const std::string& line) { add(line); };
    }
    void add(std::string_view line) {
        std::lock_guard lock(mutex_);
        lines_.emplace_back(line);
    }
    std::vector<std::string> lines() const {
        std::lock_guard lock(mutex_);
        return lines_;
    }
    void clear() {
        std::lock_guard lock(mutex_);
        lines_.clear();
    }
    // How many lines hold needle.
    std::size_t containing(std::string_view needle) const {
        std::lock_guard lock(mutex_);
        return std::count_if(lines_.begin(), lines_.end(), [&](const std::string& line) {
            return line.find(needle) != std::string::npos;
        });
    }

  private:
    mutable std::mutex mutex_;
    std::vector<std::string> lines_;
};

}  // namespace qv::test

// An IssueFiler service in memory: it counts the drafts it is asked to create and answers the
// completion at once with `error` (none by default), on the caller's thread.
#pragma once

#include <mutex>
#include <optional>
#include <string>

#include "platform/IssueFilerService.h"

namespace qv::test {

class FakeIssueFilerService : public IssueFilerService {
  public:
    void createDraft(const IssueDraft&, std::string_view, std::string_view,
                     Completion completion) override {
        std::optional<std::string> answer;
        {
            std::lock_guard lock(mutex_);
            ++count_;
            answer = error;
        }
        if (completion) {
            completion(answer);
        }
    }

    std::size_t count() const {
        std::lock_guard lock(mutex_);
        return count_;
    }

    std::optional<std::string> error;

  private:
    mutable std::mutex mutex_;
    std::size_t count_ = 0;
};

}  // namespace qv::test

// An IssueFiler service in memory: it records the process of every draft it is asked to create
// and answers the completion at once with `error` (none by default), on the caller's thread.
#pragma once

#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/IssueFilerService.h"

namespace qv::test {

class FakeIssueFilerService : public IssueFilerService {
  public:
    struct Request {
        std::string processName;
    };

    void createDraft(const IssueDraft&, std::string_view processName, std::string_view,
                     Completion completion) override {
        std::optional<std::string> answer;
        {
            std::lock_guard lock(mutex_);
            requests.push_back({std::string(processName)});
            answer = error;
        }
        if (completion) {
            completion(answer);
        }
    }

    std::size_t count() const {
        std::lock_guard lock(mutex_);
        return requests.size();
    }

    std::optional<std::string> error;
    std::vector<Request> requests;

  private:
    mutable std::mutex mutex_;
};

}  // namespace qv::test

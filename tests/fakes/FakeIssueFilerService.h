// An IssueFiler service in memory: it records every draft it is asked to create and answers the
// completion at once with `error` (none by default), on the caller's thread.
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
        IssueDraft draft;
        std::string processName;
        std::string displayReason;
    };

    void createDraft(const IssueDraft& draft, std::string_view processName,
                     std::string_view displayReason, Completion completion) override {
        std::optional<std::string> answer;
        {
            std::lock_guard lock(mutex_);
            requests.push_back({draft, std::string(processName), std::string(displayReason)});
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

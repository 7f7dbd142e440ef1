// A diagnostic-request service in memory: it records every request it receives. onRequest, when
// set, runs on the caller's thread after the request is recorded (a test uses it to see what else
// had happened by then).
#pragma once

#include <functional>
#include <mutex>
#include <string>
#include <vector>

#include "platform/DiagnosticRequestService.h"

namespace qv::test {

class FakeDiagnosticRequestService : public DiagnosticRequestService {
  public:
    struct Request {
        std::string description;
        Dictionary payload;
    };

    void request(std::string_view, std::string_view, std::string_view description,
                 const Dictionary& payload, const DiagnosticRequestOptions&) override {
        {
            std::lock_guard lock(mutex_);
            requests.push_back({std::string(description), payload});
        }
        if (onRequest) {
            onRequest();
        }
    }

    std::size_t count() const {
        std::lock_guard lock(mutex_);
        return requests.size();
    }

    std::function<void()> onRequest;
    std::vector<Request> requests;

  private:
    mutable std::mutex mutex_;
};

}  // namespace qv::test

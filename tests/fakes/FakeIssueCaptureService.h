// An issue-capture service in memory. It records every reporter made, every snapshot and timed
// session asked for (with signature, duration and payload) and every cancel. Replies are held
// until the test answers them with reply() (from whatever thread it likes), which is how a test
// plays a service that answers late, never, or with each of its error codes.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/IssueCaptureService.h"

namespace qv::test {

class FakeIssueCaptureService : public IssueCaptureService {
  public:
    struct Request {
        std::string kind;  // "snapshot" or "session"
        Dictionary signature;
        double duration = 0;
        std::optional<Dictionary> payload;
    };

    class Reporter : public IssueCaptureReporter {
      public:
        explicit Reporter(FakeIssueCaptureService& service) : service_(service) {}

        Dictionary makeSignature(std::string_view domain, std::string_view type,
                                 std::string_view subtype, std::string_view subtypeContext,
                                 std::string_view detectedProcess,
                                 const std::optional<Dictionary>&) override {
            return {{std::string(kIssueCaptureSignatureDomain), domain},
                    {std::string(kIssueCaptureSignatureType), type},
                    {std::string(kIssueCaptureSignatureSubtype), subtype},
                    {std::string(kIssueCaptureSignatureSubtypeContext), subtypeContext},
                    {std::string(kIssueCaptureSignatureDetectedProcess), detectedProcess}};
        }
        bool snapshotWithSignature(const Dictionary& signature, double duration,
                                   const std::optional<Dictionary>&,
                                   const std::optional<Dictionary>& payload,
                                   ReplyCallback reply) override {
            return service_.record({"snapshot", signature, duration, payload}, std::move(reply));
        }
        bool startSessionWithSignature(const Dictionary& signature, double duration,
                                       const std::optional<Array>&,
                                       const std::optional<Dictionary>& payload,
                                       const std::optional<Array>&, ReplyCallback reply) override {
            return service_.record({"session", signature, duration, payload}, std::move(reply));
        }
        void cancelSession(const std::string& sessionIdentifier) override {
            std::lock_guard lock(service_.mutex_);
            service_.cancels.push_back(sessionIdentifier);
        }

      private:
        FakeIssueCaptureService& service_;
    };

    std::shared_ptr<IssueCaptureReporter> createReporter() override {
        return std::make_shared<Reporter>(*this);
    }

    // Answers every held reply with response, on the caller's thread; returns how many.
    std::size_t reply(const Dictionary& response) {
        std::vector<IssueCaptureReporter::ReplyCallback> held;
        {
            std::lock_guard lock(mutex_);
            held.swap(pending_);
        }
        for (auto& callback : held) {
            callback(response);
        }
        return held.size();
    }

    std::unique_lock<std::mutex> lock() { return std::unique_lock(mutex_); }

    // Settings.
    bool acceptParameters = true;

    // What happened (read under lock() while another thread may answer).
    std::vector<Request> requests;
    std::vector<std::string> cancels;

  private:
    bool record(Request request, IssueCaptureReporter::ReplyCallback reply) {
        std::lock_guard lock(mutex_);
        requests.push_back(std::move(request));
        if (!acceptParameters) {
            return false;
        }
        pending_.push_back(std::move(reply));
        return true;
    }

    std::mutex mutex_;
    std::vector<IssueCaptureReporter::ReplyCallback> pending_;
};

}  // namespace qv::test

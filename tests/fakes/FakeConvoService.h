// A Convo service in memory. It records every session it made (with its session info and user
// info), every message sent and every flush. The configuration completion is either called at
// once with `backends` (the default) or, with holdCompletions, kept until the test calls
// completePending() from whatever thread it likes: that is how a test plays a service that
// answers late or never.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/ConvoService.h"

namespace qv::test {

class FakeConvoService : public ConvoService {
  public:
    struct Sent {
        std::uint16_t category;
        std::uint16_t type;
        Dictionary payload;
    };

    class Session : public ConvoSession {
      public:
        Session(FakeConvoService& service, Dictionary sessionInfo, Dictionary userInfo, int number)
            : sessionInfo(std::move(sessionInfo)),
              userInfo(std::move(userInfo)),
              service_(service),
              number_(number) {}

        void startConfiguration(ConfigurationCompletion completion) override {
            std::optional<std::vector<std::string>> backends;
            {
                std::lock_guard lock(service_.mutex_);
                if (service_.holdCompletions) {
                    service_.pending_.push_back(std::move(completion));
                    return;
                }
                backends = service_.backends;
            }
            completion(backends);
        }
        std::optional<std::string> sendMessage(std::uint16_t category, std::uint16_t type,
                                               const Dictionary& payload) override {
            std::lock_guard lock(service_.mutex_);
            if (service_.sendError) {
                return service_.sendError;
            }
            sent.push_back({category, type, payload});
            return std::nullopt;
        }
        void flush() override {
            std::lock_guard lock(service_.mutex_);
            ++flushes;
        }
        std::string description() const override {
            return "<FakeConvoSession " + std::to_string(number_) + ">";
        }

        // Read these under FakeConvoService::lock() while the worker may still run.
        const Dictionary sessionInfo;
        const Dictionary userInfo;
        std::vector<Sent> sent;
        int flushes = 0;

      private:
        FakeConvoService& service_;
        const int number_;
    };

    std::optional<std::string> newHierarchyTokenFromParentToken(
        const std::optional<std::string>&) override {
        std::lock_guard lock(mutex_);
        ++tokensAsked;
        if (!available) {
            return std::nullopt;
        }
        return "token-" + std::to_string(tokensAsked);
    }

    std::shared_ptr<ConvoSession> createSession(
        const Dictionary& sessionInfo, const Dictionary& userInfo,
        const std::optional<std::vector<std::string>>&) override {
        std::lock_guard lock(mutex_);
        auto session = std::make_shared<Session>(*this, sessionInfo, userInfo,
                                                 static_cast<int>(sessions.size()) + 1);
        sessions.push_back(session);
        return session;
    }

    // Answers every held configuration with the given backends, on the caller's thread.
    void completePending(const std::optional<std::vector<std::string>>& answer) {
        std::vector<ConvoSession::ConfigurationCompletion> pending;
        {
            std::lock_guard lock(mutex_);
            pending.swap(pending_);
        }
        for (auto& completion : pending) {
            completion(answer);
        }
    }

    std::unique_lock<std::mutex> lock() { return std::unique_lock(mutex_); }

    // Settings, set before the worker runs (or under lock()).
    bool available = true;
    std::optional<std::vector<std::string>> backends = std::vector<std::string>{"jsonl"};
    bool holdCompletions = false;
    std::optional<std::string> sendError;

    // What happened (read under lock()).
    int tokensAsked = 0;
    std::vector<std::shared_ptr<Session>> sessions;

  private:
    std::mutex mutex_;
    std::vector<ConvoSession::ConfigurationCompletion> pending_;
};

}  // namespace qv::test

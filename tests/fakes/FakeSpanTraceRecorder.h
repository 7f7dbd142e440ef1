// A performance-trace recorder in memory. Each recording answers its start and its stop either at
// once on the caller's thread (the default) or never (the test plays a recorder that hangs). A
// failed start completes at once with an error, as the recorder's contract says. Everything asked
// is recorded. (Answers from the recorder's own threads: the trace end-to-end test.)
#pragma once

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/SpanTraceRecorder.h"

namespace qv::test {

class FakeSpanTraceRecorder : public SpanTraceRecorder {
  public:
    enum class Answer { Now, Never };

    class Session : public SpanTraceSession {
      public:
        Session(FakeSpanTraceRecorder& recorder, SpanTraceConfiguration configuration, int number)
            : configuration(configuration), recorder_(recorder), number_(number) {}

        void setDelegate(std::weak_ptr<SpanTraceDelegate> delegate) override {
            std::lock_guard lock(mutex_);
            delegate_ = std::move(delegate);
        }
        void start() override {
            Answer answer;
            std::optional<std::string> error;
            {
                std::lock_guard lock(recorder_.mutex_);
                ++starts;
                answer = recorder_.startAnswer;
                error = recorder_.startError;
                valid_ = !error;
            }
            recorder_.answer(answer, [this, error] {
                const auto d = delegate();
                if (!d) {
                    return;
                }
                d->spanTraceDidStart(error);
                if (error) {
                    d->spanTraceDidComplete(std::nullopt, token(), "no trace: " + *error);
                }
            });
        }
        void stop() override {
            Answer answer;
            std::optional<std::string> stopError;
            std::optional<std::string> completeError;
            std::optional<std::filesystem::path> location;
            {
                std::lock_guard lock(recorder_.mutex_);
                ++stops;
                valid_ = false;
                answer = recorder_.stopAnswer;
                stopError = recorder_.stopError;
                completeError = recorder_.completeError;
                location = recorder_.traceLocation;
            }
            recorder_.answer(answer, [this, stopError, completeError, location] {
                if (const auto d = delegate()) {
                    d->spanTraceDidStop(stopError);
                }
                // The delegate may drop its reference to this session in the first callback.
                if (const auto d = delegate()) {
                    d->spanTraceDidComplete(completeError ? std::nullopt : location, token(),
                                            completeError);
                }
            });
        }
        bool isValid() const override {
            std::lock_guard lock(recorder_.mutex_);
            return valid_;
        }
        // Whether a delegate is set (the worker clears it at completion).
        bool hasDelegate() const {
            std::lock_guard lock(mutex_);
            return !delegate_.expired();
        }

        const SpanTraceConfiguration configuration;
        int starts = 0;
        int stops = 0;

      private:
        std::shared_ptr<SpanTraceDelegate> delegate() const {
            std::lock_guard lock(mutex_);
            return delegate_.lock();
        }
        std::string token() const { return "fake-" + std::to_string(number_); }

        FakeSpanTraceRecorder& recorder_;
        const int number_;
        mutable std::mutex mutex_;
        std::weak_ptr<SpanTraceDelegate> delegate_;  // guarded by mutex_
        bool valid_ = false;                         // guarded by recorder_.mutex_
    };

    std::shared_ptr<SpanTraceConfiguration> configurationFromTemplate(int number) override {
        std::lock_guard lock(mutex_);
        templatesAsked.push_back(number);
        if (number != 2 && number != 3) {
            return nullptr;
        }
        auto configuration = std::make_shared<SpanTraceConfiguration>();
        configuration->templateNumber = number;
        return configuration;
    }
    std::shared_ptr<SpanTraceSession> createSession(
        const SpanTraceConfiguration& configuration) override {
        std::lock_guard lock(mutex_);
        auto session =
            std::make_shared<Session>(*this, configuration, static_cast<int>(sessions.size()) + 1);
        sessions.push_back(session);
        return session;
    }

    // Settings, set before the worker runs.
    Answer startAnswer = Answer::Now;
    Answer stopAnswer = Answer::Now;
    std::optional<std::string> startError;
    std::optional<std::string> stopError;
    std::optional<std::string> completeError;
    std::optional<std::filesystem::path> traceLocation;

    // What was asked.
    std::vector<int> templatesAsked;
    std::vector<std::shared_ptr<Session>> sessions;

  private:
    template <typename F>
    void answer(Answer how, F callbacks) {
        if (how == Answer::Now) {
            callbacks();
        }
    }

    mutable std::mutex mutex_;
};

}  // namespace qv::test

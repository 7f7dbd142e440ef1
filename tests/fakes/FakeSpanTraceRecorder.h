// A performance-trace recorder in memory. Each recording answers its start and its stop either at
// once on the caller's thread (the default), from a thread of its own (as the real recorder
// does), or never (the test plays a recorder that hangs). A failed start completes at once with
// an error, as the recorder's contract says. Everything asked is recorded.
#pragma once

#include <filesystem>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/SpanTraceRecorder.h"

namespace qv::test {

class FakeSpanTraceRecorder : public SpanTraceRecorder {
  public:
    enum class Answer { Now, FromThread, Never };

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
        // Read under the recorder's lock() while callbacks may run.
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

    ~FakeSpanTraceRecorder() override { joinThreads(); }

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

    // Waits for the answers given from threads.
    void joinThreads() {
        std::vector<std::thread> threads;
        {
            std::lock_guard lock(mutex_);
            threads.swap(threads_);
        }
        for (auto& t : threads) {
            t.join();
        }
    }
    std::unique_lock<std::mutex> lock() { return std::unique_lock(mutex_); }

    // Settings, set before the worker runs.
    Answer startAnswer = Answer::Now;
    Answer stopAnswer = Answer::Now;
    std::optional<std::string> startError;
    std::optional<std::string> stopError;
    std::optional<std::string> completeError;
    std::optional<std::filesystem::path> traceLocation;

    // What was asked (read under lock()).
    std::vector<int> templatesAsked;
    std::vector<std::shared_ptr<Session>> sessions;

  private:
    template <typename F>
    void answer(Answer how, F callbacks) {
        if (how == Answer::Now) {
            callbacks();
        } else if (how == Answer::FromThread) {
            std::lock_guard lock(mutex_);
            threads_.emplace_back(std::move(callbacks));
        }
    }

    mutable std::mutex mutex_;
    std::vector<std::thread> threads_;  // guarded by mutex_
};

}  // namespace qv::test

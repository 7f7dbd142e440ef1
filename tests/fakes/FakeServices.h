// In-memory fakes of the platform services; each records what it was asked.
#pragma once

#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/AnalyticsService.h"
#include "platform/NotificationCenter.h"
#include "platform/PreferenceStore.h"
#include "platform/ProcessInfo.h"
#include "platform/SystemCondition.h"

namespace qv::test {

class FakeProcessInfo : public ProcessInfo {
  public:
    std::optional<std::string> processName(std::int64_t pid) const override {
        std::lock_guard lock(mutex_);
        auto it = names.find(pid);
        return it == names.end() ? std::nullopt : std::optional<std::string>(it->second);
    }
    std::int64_t ownProcessIdentifier() const override { return 4242; }

    std::map<std::int64_t, std::string> names;

  private:
    mutable std::mutex mutex_;
};

class FakePreferenceStore : public PreferenceStore {
  public:
    std::optional<Value> value(std::string_view suite, std::string_view key) const override {
        std::lock_guard lock(mutex_);
        auto s = suites_.find(std::string(suite));
        if (s == suites_.end())
            return std::nullopt;
        const Value* v = s->second.find(key);
        return v ? std::optional<Value>(*v) : std::nullopt;
    }
    Dictionary values(std::string_view suite) const override {
        std::lock_guard lock(mutex_);
        auto s = suites_.find(std::string(suite));
        return s == suites_.end() ? Dictionary{} : s->second;
    }
    bool setValue(std::string_view suite, std::string_view key, const Value& value) override {
        std::lock_guard lock(mutex_);
        suites_[std::string(suite)].set(key, value);
        return true;
    }
    bool removeValue(std::string_view suite, std::string_view key) override {
        std::lock_guard lock(mutex_);
        suites_[std::string(suite)].erase(key);
        return true;
    }

  private:
    mutable std::mutex mutex_;
    std::map<std::string, Dictionary> suites_;
};

// Handlers run through their runner on the poster's thread.
class FakeNotificationCenter : public NotificationCenter {
  public:
    std::optional<Token> registerNotification(std::string_view name, TaskRunner runner,
                                              Handler handler) override {
        std::lock_guard lock(mutex_);
        const Token token = nextToken_++;
        registrations_[token] = {std::string(name), std::move(runner), std::move(handler)};
        return token;
    }
    void cancel(Token token) override {
        std::lock_guard lock(mutex_);
        registrations_.erase(token);
        cancelled.push_back(token);
    }
    std::optional<std::uint64_t> getState(Token token) const override {
        std::lock_guard lock(mutex_);
        auto it = registrations_.find(token);
        if (it == registrations_.end())
            return std::nullopt;
        auto s = states_.find(it->second.name);
        return s == states_.end() ? 0 : s->second;
    }
    std::uint64_t stateOf(std::string_view name) const override {
        std::lock_guard lock(mutex_);
        auto s = states_.find(std::string(name));
        return s == states_.end() ? 0 : s->second;
    }
    void post(std::string_view name, std::uint64_t state) override {
        std::vector<std::pair<Token, Registration>> targets;
        {
            std::lock_guard lock(mutex_);
            states_[std::string(name)] = state;
            for (const auto& [token, r] : registrations_) {
                if (r.name == name)
                    targets.emplace_back(token, r);
            }
        }
        for (auto& [token, r] : targets) {
            r.runner([handler = r.handler, token = token] { handler(token); });
        }
    }

    std::vector<Token> cancelled;

  private:
    struct Registration {
        std::string name;
        TaskRunner runner;
        Handler handler;
    };
    mutable std::mutex mutex_;
    Token nextToken_ = 1;
    std::map<Token, Registration> registrations_;
    std::map<std::string, std::uint64_t> states_;
};

// A name is used unless listed in unused; producers run at once.
class FakeAnalyticsService : public AnalyticsService {
  public:
    struct Event {
        std::string name;
        Dictionary payload;
    };

    bool isEventUsed(std::string_view eventName) const override {
        std::lock_guard lock(mutex_);
        queried.emplace_back(eventName);
        for (const auto& u : unused) {
            if (u == eventName)
                return false;
        }
        return true;
    }
    void sendEventLazy(std::string_view eventName, PayloadProducer producer) override {
        Dictionary payload = producer();
        std::lock_guard lock(mutex_);
        events.push_back({std::string(eventName), std::move(payload)});
    }
    std::vector<Event> eventsNamed(std::string_view name) const {
        std::lock_guard lock(mutex_);
        std::vector<Event> out;
        for (const auto& e : events) {
            if (e.name == name)
                out.push_back(e);
        }
        return out;
    }

    std::vector<std::string> unused;
    std::vector<Event> events;
    mutable std::vector<std::string> queried;

  private:
    mutable std::mutex mutex_;
};

// footprintError makes the memory query fail.
class FakeSystemCondition : public SystemCondition {
  public:
    ThermalState thermalState() const override { return thermal; }
    bool lowPowerModeEnabled() const override { return lowPower; }
    std::optional<std::uint64_t> ownMemoryFootprint(std::string& error) const override {
        if (!footprintError.empty()) {
            error = footprintError;
            return std::nullopt;
        }
        return footprintBytes;
    }
    std::array<double, 3> loadAverages() const override { return loads; }

    ThermalState thermal = ThermalState::Nominal;
    bool lowPower = false;
    std::uint64_t footprintBytes = 0;
    std::string footprintError;
    std::array<double, 3> loads{0.0, 0.0, 0.0};
};

}  // namespace qv::test

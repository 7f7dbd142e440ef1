#include "platform/linux/system/LinuxNotificationCenter.h"

#include <limits>
#include <utility>
#include <vector>

namespace qv {

LinuxNotificationCenter::LinuxNotificationCenter(std::size_t maxNames) : maxNames_(maxNames) {}

std::optional<NotificationCenter::Token> LinuxNotificationCenter::registerNotification(
    std::string_view name, TaskRunner runner, Handler handler) {
    if (!runner || !handler) {
        return std::nullopt;
    }
    std::lock_guard lock(mutex_);
    if (lastToken_ == std::numeric_limits<Token>::max()) {
        return std::nullopt;
    }
    const Token token = ++lastToken_;
    registrations_.emplace(token, Registration{std::string(name), std::move(runner),
                                               std::make_shared<const Handler>(std::move(handler)),
                                               std::make_shared<std::atomic<bool>>(true)});
    return token;
}

void LinuxNotificationCenter::cancel(Token token) {
    std::lock_guard lock(mutex_);
    auto it = registrations_.find(token);
    if (it == registrations_.end()) {
        return;
    }
    it->second.live->store(false);
    registrations_.erase(it);
}

std::optional<std::uint64_t> LinuxNotificationCenter::getState(Token token) const {
    std::lock_guard lock(mutex_);
    auto it = registrations_.find(token);
    if (it == registrations_.end()) {
        return std::nullopt;
    }
    auto state = states_.find(it->second.name);
    return state == states_.end() ? 0 : state->second;
}

std::uint64_t LinuxNotificationCenter::stateOf(std::string_view name) const {
    std::lock_guard lock(mutex_);
    auto state = states_.find(name);
    return state == states_.end() ? 0 : state->second;
}

void LinuxNotificationCenter::post(std::string_view name, std::uint64_t state) {
    struct Delivery {
        Token token;
        TaskRunner runner;
        std::shared_ptr<const Handler> handler;
        std::shared_ptr<std::atomic<bool>> live;
    };
    std::vector<Delivery> deliveries;
    std::shared_ptr<const PostObserver> observer;
    {
        std::lock_guard lock(mutex_);
        if (auto it = states_.find(name); it != states_.end()) {
            it->second = state;
        } else if ((states_.size() < maxNames_ && name.size() <= kMaxNameLength) ||
                   watchedLocked(name)) {
            states_.emplace(std::string(name), state);
        } else {
            droppedStates_.fetch_add(1, std::memory_order_relaxed);
        }
        for (const auto& [token, registration] : registrations_) {
            if (registration.name == name) {
                deliveries.push_back(
                    {token, registration.runner, registration.handler, registration.live});
            }
        }
        observer = postObserver_;
    }
    for (Delivery& delivery : deliveries) {
        delivery.runner([token = delivery.token, handler = std::move(delivery.handler),
                         live = std::move(delivery.live)] {
            if (live->load()) {
                (*handler)(token);
            }
        });
    }
    if (observer) {
        (*observer)(std::string(name), state);
    }
}

void LinuxNotificationCenter::setPostObserver(PostObserver observer) {
    auto shared = observer ? std::make_shared<const PostObserver>(std::move(observer)) : nullptr;
    std::lock_guard lock(mutex_);
    postObserver_ = std::move(shared);
}

bool LinuxNotificationCenter::watchedLocked(std::string_view name) const {
    for (const auto& [token, registration] : registrations_) {
        if (registration.name == name) {
            return true;
        }
    }
    return false;
}

}  // namespace qv

// Waiting on real processes: poll a condition until it holds or a deadline passes. The default
// deadline holds on a machine whose cores are both busy; a test asserts on the condition, never on
// how long it took.
#pragma once

#include <chrono>
#include <functional>
#include <thread>

namespace qv::test {

inline bool waitUntil(const std::function<bool()>& condition,
                      std::chrono::milliseconds timeout = std::chrono::seconds(30)) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    while (!condition()) {
        if (std::chrono::steady_clock::now() > deadline) {
            return false;
        }
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
    }
    return true;
}

}  // namespace qv::test

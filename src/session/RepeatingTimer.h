// A repeating timer on a thread of its own: calls its handler every interval until invalidated.
// The handler may invalidate (and even destroy) its own timer.
//
// Thread safety: invalidate() may be called from any thread, the handler's included; once it
// returns (outside the handler) the handler is not running and will not run again.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>

namespace qv {

class RepeatingTimer {
  public:
    RepeatingTimer(std::chrono::duration<double> interval, std::function<void()> handler);
    ~RepeatingTimer();

    RepeatingTimer(const RepeatingTimer&) = delete;
    RepeatingTimer& operator=(const RepeatingTimer&) = delete;

    void invalidate();
    bool isValid() const;

  private:
    struct State;
    std::shared_ptr<State> state_;  // shared with the thread, which may outlive this object
    std::thread thread_;
};

}  // namespace qv

// A semaphore whose time-outs pass on a fake clock: a wait that finds no signal moves the clock
// on by its whole time-out and reports the time-out at once, so a test reaches a 180-second
// time-out without sleeping. Every wait's time-out is recorded.
#pragma once

#include <vector>

#include "fakes/FakeClock.h"
#include "session/QVReportingSemaphore.h"

namespace qv::test {

class FakeClockSemaphore : public QVReportingSemaphore {
  public:
    explicit FakeClockSemaphore(FakeClock& clock) : clock_(clock) {}

    bool wait(double timeoutSeconds) override {
        waits.push_back(timeoutSeconds);
        if (tryTake()) {
            return true;
        }
        clock_.advance(timeoutSeconds);
        timeouts.push_back(timeoutSeconds);
        return false;
    }

    std::vector<double> waits;
    std::vector<double> timeouts;

  private:
    FakeClock& clock_;
};

}  // namespace qv::test

// A Platform made of fakes, each reachable by the test.
#pragma once

#include "fakes/FakeClock.h"
#include "fakes/FakeDeviceInformation.h"
#include "platform/Platform.h"

namespace qv::test {

struct FakePlatform {
    FakeClock clock;
    FakeDeviceInformation device;
    Platform platform{clock, device};
};

}  // namespace qv::test

// A Platform made of fakes, each reachable by the test.
#pragma once

#include "fakes/FakeClock.h"
#include "fakes/FakeDeviceInformation.h"
#include "fakes/FakeServices.h"
#include "platform/Platform.h"

namespace qv::test {

struct FakePlatform {
    FakeClock clock;
    FakeDeviceInformation device;
    FakeProcessInfo process;
    FakePreferenceStore preferences;
    FakeNotificationCenter notifications;
    FakeAnalyticsService analytics;
    FakeSystemCondition condition;
    Platform platform{clock, device, process, preferences, notifications, analytics, condition};
};

}  // namespace qv::test

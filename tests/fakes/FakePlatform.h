// A Platform made of fakes, each reachable by the test.
#pragma once

#include "fakes/FakeClock.h"
#include "fakes/FakeConvoService.h"
#include "fakes/FakeDeviceInformation.h"
#include "fakes/FakeServices.h"
#include "fakes/FakeTaskExecutor.h"
#include "platform/Platform.h"

namespace qv::test {

struct FakePlatform {
    // Services a test puts in place of the fakes; those left null stay the fakes.
    struct Replacements {
        AnalyticsService* analytics = nullptr;
        ConvoService* convo = nullptr;
        TaskExecutor* executor = nullptr;
    };

    // The fakes' platform with some services replaced, for a test that brings its own.
    Platform with(const Replacements& r) {
        return Platform{clock,
                        device,
                        process,
                        preferences,
                        notifications,
                        r.analytics ? *r.analytics : analytics,
                        condition,
                        r.convo ? *r.convo : convo,
                        r.executor ? *r.executor : executor};
    }

    FakeClock clock;
    FakeDeviceInformation device;
    FakeProcessInfo process;
    FakePreferenceStore preferences;
    FakeNotificationCenter notifications;
    FakeAnalyticsService analytics;
    FakeSystemCondition condition;
    FakeConvoService convo;
    FakeTaskExecutor executor{clock};
    Platform platform = with({});
};

}  // namespace qv::test

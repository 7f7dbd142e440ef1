// A Platform made of fakes, each reachable by the test.
#pragma once

#include "fakes/FakeBluetoothFacility.h"
#include "fakes/FakeClock.h"
#include "fakes/FakeConvoService.h"
#include "fakes/FakeDeviceInformation.h"
#include "fakes/FakeIssueCaptureService.h"
#include "fakes/FakeServices.h"
#include "platform/Platform.h"

namespace qv::test {

struct FakePlatform {
    // Services a test puts in place of the fakes; those left null stay the fakes.
    struct Replacements {
        DeviceInformation* device = nullptr;
        AnalyticsService* analytics = nullptr;
        ConvoService* convo = nullptr;
        BluetoothFacility* bluetooth = nullptr;
        IssueCaptureService* issueCapture = nullptr;
    };

    // The fakes' platform with some services replaced, for a test that brings its own.
    Platform with(const Replacements& r) {
        return Platform{clock,
                        r.device ? *r.device : device,
                        process,
                        preferences,
                        notifications,
                        r.analytics ? *r.analytics : analytics,
                        condition,
                        r.convo ? *r.convo : convo,
                        r.bluetooth ? *r.bluetooth : bluetooth,
                        r.issueCapture ? *r.issueCapture : issueCapture};
    }

    FakeClock clock;
    FakeDeviceInformation device;
    FakeProcessInfo process;
    FakePreferenceStore preferences;
    FakeNotificationCenter notifications;
    FakeAnalyticsService analytics;
    FakeSystemCondition condition;
    FakeConvoService convo;
    FakeBluetoothFacility bluetooth;
    FakeIssueCaptureService issueCapture;
    Platform platform = with({});
};

}  // namespace qv::test

// A Platform made of fakes, each reachable by the test.
#pragma once

#include "fakes/FakeBluetoothFacility.h"
#include "fakes/FakeClock.h"
#include "fakes/FakeConvoService.h"
#include "fakes/FakeDeviceInformation.h"
#include "fakes/FakeDiagnosticRequestService.h"
#include "fakes/FakeEnergyLogService.h"
#include "fakes/FakeGaugeDataWriter.h"
#include "fakes/FakeIssueCaptureService.h"
#include "fakes/FakeIssueFilerService.h"
#include "fakes/FakeMTXMetricsService.h"
#include "fakes/FakeProcessLauncher.h"
#include "fakes/FakeServices.h"
#include "fakes/FakeSpanTraceRecorder.h"
#include "fakes/FakeStatFeed.h"
#include "fakes/FakeTaskExecutor.h"
#include "fakes/FakeThreadlineModelReader.h"
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
    FakeConvoService convo;
    FakeBluetoothFacility bluetooth;
    FakeIssueCaptureService issueCapture;
    FakeIssueFilerService issueFiler;
    FakeDiagnosticRequestService diagnostics;
    FakeSpanTraceRecorder spanTrace;
    FakeThreadlineModelReader threadline;
    FakeGaugeDataWriter gaugeData;
    FakeStatFeed statFeed;
    FakeProcessLauncher processLauncher;
    FakeMTXMetricsService mtx;
    FakeEnergyLogService energyLog;
    FakeTaskExecutor executor{clock};
    Platform platform{clock,      device,          process,   preferences, notifications,
                      analytics,  condition,       convo,     bluetooth,   issueCapture,
                      issueFiler, diagnostics,     spanTrace, threadline,  gaugeData,
                      statFeed,   processLauncher, mtx,       energyLog,   executor};

    // The platform with some services replaced, for a caller that brings its own.
    Platform with(const PlatformReplacements& r) const { return withReplacements(platform, r); }
};

}  // namespace qv::test

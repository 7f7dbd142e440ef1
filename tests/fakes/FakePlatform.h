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
    // Services a test puts in place of the fakes; those left null stay the fakes.
    struct Replacements {
        DeviceInformation* device = nullptr;
        ProcessInfo* process = nullptr;
        PreferenceStore* preferences = nullptr;
        NotificationCenter* notifications = nullptr;
        AnalyticsService* analytics = nullptr;
        SystemCondition* condition = nullptr;
        ConvoService* convo = nullptr;
        BluetoothFacility* bluetooth = nullptr;
        IssueCaptureService* issueCapture = nullptr;
        IssueFilerService* issueFiler = nullptr;
        DiagnosticRequestService* diagnostics = nullptr;
        SpanTraceRecorder* spanTrace = nullptr;
        ThreadlineModelReader* threadline = nullptr;
        GaugeDataWriter* gaugeData = nullptr;
        StatFeed* statFeed = nullptr;
        ProcessLauncher* processLauncher = nullptr;
        MTXMetricsService* mtx = nullptr;
        EnergyLogService* energyLog = nullptr;
        TaskExecutor* executor = nullptr;
    };

    // The fakes' platform with some services replaced, for a test that brings its own.
    Platform with(const Replacements& r) {
        return Platform{clock,
                        r.device ? *r.device : device,
                        r.process ? *r.process : process,
                        r.preferences ? *r.preferences : preferences,
                        r.notifications ? *r.notifications : notifications,
                        r.analytics ? *r.analytics : analytics,
                        r.condition ? *r.condition : condition,
                        r.convo ? *r.convo : convo,
                        r.bluetooth ? *r.bluetooth : bluetooth,
                        r.issueCapture ? *r.issueCapture : issueCapture,
                        r.issueFiler ? *r.issueFiler : issueFiler,
                        r.diagnostics ? *r.diagnostics : diagnostics,
                        r.spanTrace ? *r.spanTrace : spanTrace,
                        r.threadline ? *r.threadline : threadline,
                        r.gaugeData ? *r.gaugeData : gaugeData,
                        r.statFeed ? *r.statFeed : statFeed,
                        r.processLauncher ? *r.processLauncher : processLauncher,
                        r.mtx ? *r.mtx : mtx,
                        r.energyLog ? *r.energyLog : energyLog,
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
    Platform platform = with({});
};

}  // namespace qv::test

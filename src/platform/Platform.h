// The platform services the daemon reaches, one reference each. main() builds one from the Linux
// implementations and hands it down to the service, sessions and workers; tests build one of
// fakes. Nothing below main() looks a platform service up anywhere else.
#pragma once

namespace qv {

class AnalyticsService;
class BluetoothFacility;
class Clock;
class ConvoService;
class DeviceInformation;
class IssueCaptureService;
class DiagnosticRequestService;
class IssueFilerService;
class GaugeDataWriter;
class EnergyLogService;
class MTXMetricsService;
class NotificationCenter;
class PreferenceStore;
class ProcessInfo;
class SpanTraceRecorder;
class ProcessLauncher;
class StatFeed;
class SystemCondition;
class ThreadlineModelReader;
class TaskExecutor;

struct Platform {
    Clock& clock;
    DeviceInformation& device;
    ProcessInfo& process;
    PreferenceStore& preferences;
    NotificationCenter& notifications;
    AnalyticsService& analytics;
    SystemCondition& condition;
    ConvoService& convo;
    BluetoothFacility& bluetooth;
    IssueCaptureService& issueCapture;
    IssueFilerService& issueFiler;
    DiagnosticRequestService& diagnostics;
    SpanTraceRecorder& spanTrace;
    ThreadlineModelReader& threadline;
    GaugeDataWriter& gaugeData;
    StatFeed& statFeed;
    ProcessLauncher& processLauncher;
    MTXMetricsService& mtx;
    EnergyLogService& energyLog;
    TaskExecutor& executor;
};

// Services to put in place of a platform's own; those left null stay. Tests and benchmarks use it
// to bring one service of their own while keeping the rest.
struct PlatformReplacements {
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

// base with r's services in place of its own.
inline Platform withReplacements(const Platform& base, const PlatformReplacements& r) {
    return Platform{base.clock,
                    r.device ? *r.device : base.device,
                    r.process ? *r.process : base.process,
                    r.preferences ? *r.preferences : base.preferences,
                    r.notifications ? *r.notifications : base.notifications,
                    r.analytics ? *r.analytics : base.analytics,
                    r.condition ? *r.condition : base.condition,
                    r.convo ? *r.convo : base.convo,
                    r.bluetooth ? *r.bluetooth : base.bluetooth,
                    r.issueCapture ? *r.issueCapture : base.issueCapture,
                    r.issueFiler ? *r.issueFiler : base.issueFiler,
                    r.diagnostics ? *r.diagnostics : base.diagnostics,
                    r.spanTrace ? *r.spanTrace : base.spanTrace,
                    r.threadline ? *r.threadline : base.threadline,
                    r.gaugeData ? *r.gaugeData : base.gaugeData,
                    r.statFeed ? *r.statFeed : base.statFeed,
                    r.processLauncher ? *r.processLauncher : base.processLauncher,
                    r.mtx ? *r.mtx : base.mtx,
                    r.energyLog ? *r.energyLog : base.energyLog,
                    r.executor ? *r.executor : base.executor};
}

}  // namespace qv

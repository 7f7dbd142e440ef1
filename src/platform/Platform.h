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

}  // namespace qv

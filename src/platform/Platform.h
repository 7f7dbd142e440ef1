// The platform services the daemon reaches, one reference each. main() builds one from the Linux
// implementations and hands it down to the service, sessions and workers; tests build one of
// fakes. Nothing below main() looks a platform service up anywhere else.
#pragma once

namespace qv {

class AnalyticsService;
class Clock;
class ConvoService;
class DeviceInformation;
class NotificationCenter;
class PreferenceStore;
class ProcessInfo;
class SystemCondition;
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
    TaskExecutor& executor;
};

}  // namespace qv

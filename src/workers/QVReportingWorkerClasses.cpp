#include "workers/QVReportingWorkerClasses.h"

#include "monitoring/QVReportingSessionDriverSnapshotWorker.h"
#include "monitoring/QVReportingSessionMemoryLogWorker.h"
#include "monitoring/QVReportingSessionSystemMonitorWorker.h"
#include "workers/backends/QVReportingSessionAudioRegistrationWorker.h"
#include "workers/backends/QVReportingSessionConvoWorker.h"
#include "workers/backends/QVReportingSessionEnergyLogWorker.h"
#include "workers/backends/QVReportingSessionMTXWorker.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"
#include "workers/derived/QVReportingSessionInputMessagesWorker.h"
#include "workers/derived/QVReportingSessionOrbitMessagesWorker.h"
#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"
#include "workers/derived/QVReportingSessionSummaryWorker.h"
#include "workers/derived/QVReportingSessionVolumeMessagesWorker.h"
#include "workers/diagnostics/QVReportingSessionICXWorker.h"
#include "workers/diagnostics/QVReportingSessionIssueFilerWorker.h"
#include "workers/diagnostics/QVReportingSessionPulsarWorker.h"
#include "workers/diagnostics/QVReportingSessionTraceWorker.h"

namespace qv {

QVReportingWorkerRegistry::ClassList QVReportingAllWorkerClasses() {
    // Fixed order: trace, volume, orbit, summary, input, MetricsHub, EnergyLog, memory log, MTX,
    // driver snapshot, system monitor, ICX, Pulsar, summary JSON file, audio registration, Convo,
    // IssueFiler.
    return {
        &makeWorkerClass<QVReportingSessionTraceWorker>(),
        &makeWorkerClass<QVReportingSessionVolumeMessagesWorker>(),
        &makeWorkerClass<QVReportingSessionOrbitMessagesWorker>(),
        &makeWorkerClass<QVReportingSessionSummaryWorker>(),
        &makeWorkerClass<QVReportingSessionInputMessagesWorker>(),
        &makeWorkerClass<QVReportingSessionMetricsHubWorker>(),
        &makeWorkerClass<QVReportingSessionEnergyLogWorker>(),
        &makeWorkerClass<QVReportingSessionMemoryLogWorker>(),
        &makeWorkerClass<QVReportingSessionMTXWorker>(),
        &makeWorkerClass<QVReportingSessionDriverSnapshotWorker>(),
        &makeWorkerClass<QVReportingSessionSystemMonitorWorker>(),
        &makeWorkerClass<QVReportingSessionICXWorker>(),
        &makeWorkerClass<QVReportingSessionPulsarWorker>(),
        &makeWorkerClass<QVReportingSessionSummaryJsonFileWorker>(),
        &makeWorkerClass<QVReportingSessionAudioRegistrationWorker>(),
        &makeWorkerClass<QVReportingSessionConvoWorker>(),
        &makeWorkerClass<QVReportingSessionIssueFilerWorker>(),
    };
}

}  // namespace qv

#include "workers/QVReportingWorkerClasses.h"

#include "monitoring/QVReportingSessionSystemMonitorWorker.h"
#include "workers/backends/QVReportingSessionConvoWorker.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"
#include "workers/derived/QVReportingSessionInputMessagesWorker.h"
#include "workers/derived/QVReportingSessionOrbitMessagesWorker.h"
#include "workers/derived/QVReportingSessionSummaryJsonFileWorker.h"
#include "workers/derived/QVReportingSessionSummaryWorker.h"
#include "workers/derived/QVReportingSessionVolumeMessagesWorker.h"

namespace qv {

QVReportingWorkerRegistry::ClassList QVReportingAllWorkerClasses() {
    // Fixed order: trace, volume, orbit, summary, input, MetricsHub, EnergyLog, memory log, MTX,
    // driver snapshot, system monitor, ICX, Pulsar, summary JSON file, audio registration, Convo,
    // IssueFiler. Only the classes that exist are listed.
    return {
        &makeWorkerClass<QVReportingSessionVolumeMessagesWorker>(),
        &makeWorkerClass<QVReportingSessionOrbitMessagesWorker>(),
        &makeWorkerClass<QVReportingSessionSummaryWorker>(),
        &makeWorkerClass<QVReportingSessionInputMessagesWorker>(),
        &makeWorkerClass<QVReportingSessionMetricsHubWorker>(),
        &makeWorkerClass<QVReportingSessionSystemMonitorWorker>(),
        &makeWorkerClass<QVReportingSessionSummaryJsonFileWorker>(),
        &makeWorkerClass<QVReportingSessionConvoWorker>(),
    };
}

}  // namespace qv

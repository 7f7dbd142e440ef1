#include "monitoring/QVReportingSessionDriverSnapshotWorker.h"

#include "session/QVReportingSession.h"

namespace qv {

std::shared_ptr<QVReportingSessionDriverSnapshotWorker>
QVReportingSessionDriverSnapshotWorker::initWithSession(
    const std::shared_ptr<QVReportingSession>& session) {
    if (!session) {
        return nullptr;
    }
    auto worker = std::make_shared<QVReportingSessionDriverSnapshotWorker>();
    worker->setSession(session);
    return worker;
}

bool QVReportingSessionDriverSnapshotWorker::start() {
    const auto session = this->session();
    if (!session) {
        return true;
    }
    driverSnapShot_ =
        QVReportingDriverUtility::sharedUtility(session->platform().statFeed)->getSnapShot();
    return true;
}

void QVReportingSessionDriverSnapshotWorker::stop() {
    // The utility is made by a start; a process in which none happened has nothing to report.
    if (const auto utility = QVReportingDriverUtility::existingUtility()) {
        utility->sendDriverLogsForSession(session(), driverSnapShot_ ? &*driverSnapShot_ : nullptr);
    }
    driverSnapShot_.reset();
}

}  // namespace qv

// Derives messages about shared-playback activity. Its derivation rules are not defined yet, so
// for now it is a producer that derives nothing: it holds its place in the worker order.
#pragma once

#include <memory>
#include <string_view>

#include "session/QVReportingSessionWorker.h"

namespace qv {

class QVReportingSessionOrbitMessagesWorker final
    : public QVReportingSessionWorkerProducerProtocol {
  public:
    static constexpr std::string_view kClassName = "QVReportingSessionOrbitMessagesWorker";

    static std::shared_ptr<QVReportingSessionOrbitMessagesWorker> initWithSession(
        const std::shared_ptr<QVReportingSession>& session) {
        auto worker = std::make_shared<QVReportingSessionOrbitMessagesWorker>();
        worker->setSession(session);
        return worker;
    }
};

}  // namespace qv

// How a worker class is named and described to the registry: its name, which of the three worker
// interfaces it implements, its class switches and its factory. Descriptors are compared by
// address; each worker class has exactly one, made by makeWorkerClass<T>().
#pragma once

#include <memory>
#include <string_view>
#include <type_traits>

namespace qv {

class QVReportingSession;
class QVReportingSessionWorkerProtocol;
class QVReportingSessionWorkerProducerProtocol;
class QVReportingSessionWorkerConsumerProtocol;

struct QVReportingWorkerClass {
    using Factory = std::shared_ptr<QVReportingSessionWorkerProtocol> (*)(
        const std::shared_ptr<QVReportingSession>& session);

    std::string_view name;
    bool isConsumer = false;
    bool isProducer = false;
    bool startOnInit = false;
    bool handleSingleMessageSession = false;
    // Whether instances have a start of their own; without one a worker is simply marked started.
    bool implementsStart = false;
    // initWithSession: — null for a class whose instances cannot be made (the registry skips it);
    // the factory itself returns null when the worker does not apply to the session.
    Factory initWithSession = nullptr;
};

}  // namespace qv

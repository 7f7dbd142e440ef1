// The worker contract: every worker implements the base interface, and a worker that receives
// the session's messages implements the consumer interface, one that derives messages at stop the
// producer interface (a class may be both).
//
// A worker holds its session weakly: the session owns its workers, never the other way round.
// Workers run on the reporting server queue, like their session.
#pragma once

#include <atomic>
#include <memory>

#include "session/QVReportingSessionMessage.h"
#include "session/QVReportingWorkerClass.h"

namespace qv {

class QVReportingSession;

class QVReportingSessionWorkerProtocol {
  public:
    QVReportingSessionWorkerProtocol() = default;
    QVReportingSessionWorkerProtocol(const QVReportingSessionWorkerProtocol&) = delete;
    QVReportingSessionWorkerProtocol& operator=(const QVReportingSessionWorkerProtocol&) = delete;
    virtual ~QVReportingSessionWorkerProtocol() = default;

    std::shared_ptr<QVReportingSession> session() const { return session_.lock(); }
    void setSession(const std::weak_ptr<QVReportingSession>& session) { session_ = session; }
    // Atomic: a platform service's completion may mark a worker started from its own thread.
    bool started() const { return started_.load(std::memory_order_relaxed); }
    void setStarted(bool started) { started_.store(started, std::memory_order_relaxed); }
    // The class this worker was made from; set by the session when it adds the worker.
    const QVReportingWorkerClass* workerClass() const { return workerClass_; }
    void setWorkerClass(const QVReportingWorkerClass* cls) { workerClass_ = cls; }

    // Begins work; the result becomes started(). Called only for classes that declare a start of
    // their own (QVReportingWorkerClass::implementsStart).
    virtual bool start() { return true; }
    // Ends work: producers derive their messages here, consumers flush.
    virtual void stop() {}

  private:
    std::weak_ptr<QVReportingSession> session_;
    std::atomic<bool> started_{false};
    const QVReportingWorkerClass* workerClass_ = nullptr;
};

// Marks a worker whose output is messages derived from the session's stored messages at stop.
class QVReportingSessionWorkerProducerProtocol : public virtual QVReportingSessionWorkerProtocol {};

class QVReportingSessionWorkerConsumerProtocol : public virtual QVReportingSessionWorkerProtocol {
  public:
    // Receives one message the session accepted.
    virtual void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& message) = 0;
    // True: also receive messages the session marked redundant.
    virtual bool handleRedundantMessages() const { return false; }
};

// The descriptor of worker class T. T names itself with `static constexpr std::string_view
// kClassName`, may declare `static bool startOnInit()` and `static bool
// handleSingleMessageSession()`, and provides `static std::shared_ptr<T> initWithSession(const
// std::shared_ptr<QVReportingSession>&)`. Everything else is read off the type.
template <typename T>
const QVReportingWorkerClass& makeWorkerClass() {
    static const QVReportingWorkerClass cls = [] {
        QVReportingWorkerClass c;
        c.name = T::kClassName;
        c.isConsumer = std::is_base_of_v<QVReportingSessionWorkerConsumerProtocol, T>;
        c.isProducer = std::is_base_of_v<QVReportingSessionWorkerProducerProtocol, T>;
        if constexpr (requires { T::startOnInit(); }) {
            c.startOnInit = T::startOnInit();
        }
        if constexpr (requires { T::handleSingleMessageSession(); }) {
            c.handleSingleMessageSession = T::handleSingleMessageSession();
        }
        c.implementsStart = !std::is_same_v<decltype(&T::start),
                                            decltype(&QVReportingSessionWorkerProtocol::start)>;
        c.initWithSession = [](const std::shared_ptr<QVReportingSession>& session)
            -> std::shared_ptr<QVReportingSessionWorkerProtocol> {
            return T::initWithSession(session);
        };
        return c;
    }();
    return cls;
}

}  // namespace qv

// Worker classes for tests of the worker mechanics. Each records what happens to it in a shared
// journal, so tests can check orders across workers.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorker.h"

namespace qv::test {

// What happened, in order: "start:Name", "stop:Name", "handle:Name:<audiotag>".
inline std::vector<std::string>& workerJournal() {
    static std::vector<std::string> journal;
    return journal;
}

// Behaviour switches that tests set before creating sessions.
struct TestWorkerSwitches {
    bool startResult = true;
    bool refuseSession = false;  // initWithSession returns null
    // Called from the producer's stop; may send derived messages into the session.
    std::function<void(QVReportingSession&)> onStop;
};

template <typename Self>
class RecordingWorker {
  public:
    static TestWorkerSwitches& switches() {
        static TestWorkerSwitches s;
        return s;
    }
    static std::shared_ptr<Self> initWithSession(const std::shared_ptr<QVReportingSession>& s) {
        if (switches().refuseSession) {
            return nullptr;
        }
        auto worker = std::make_shared<Self>();
        worker->setSession(s);
        return worker;
    }
};

// A consumer started when the session is created, also serving single-message sessions.
class TestOnInitConsumer final : public QVReportingSessionWorkerConsumerProtocol,
                                 public RecordingWorker<TestOnInitConsumer> {
  public:
    static constexpr std::string_view kClassName = "TestOnInitConsumer";
    static bool startOnInit() { return true; }
    static bool handleSingleMessageSession() { return true; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& m) override {
        received.push_back(m);
        workerJournal().push_back("handle:TestOnInitConsumer:" +
                                  std::string(*m->message().find("audiotag")->asString()));
    }
    std::vector<std::shared_ptr<QVReportingSessionMessage>> received;
};

// A consumer made at start, with a start of its own, that also takes redundant messages.
class TestRedundantConsumer final : public QVReportingSessionWorkerConsumerProtocol,
                                    public RecordingWorker<TestRedundantConsumer> {
  public:
    static constexpr std::string_view kClassName = "TestRedundantConsumer";
    bool start() override {
        workerJournal().push_back("start:TestRedundantConsumer");
        return switches().startResult;
    }
    void stop() override { workerJournal().push_back("stop:TestRedundantConsumer"); }
    bool handleRedundantMessages() const override { return true; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& m) override {
        received.push_back(m);
        workerJournal().push_back("handle:TestRedundantConsumer:" +
                                  std::string(*m->message().find("audiotag")->asString()));
    }
    std::vector<std::shared_ptr<QVReportingSessionMessage>> received;
};

// A producer that derives messages at stop through its switches' onStop.
class TestProducer final : public QVReportingSessionWorkerProducerProtocol,
                           public RecordingWorker<TestProducer> {
  public:
    static constexpr std::string_view kClassName = "TestProducer";
    bool start() override {
        workerJournal().push_back("start:TestProducer");
        return true;
    }
    void stop() override {
        workerJournal().push_back("stop:TestProducer");
        if (switches().onStop) {
            switches().onStop(*session());
        }
    }
};

// Both a producer and a consumer, with no start of its own.
class TestProducerConsumer final : public QVReportingSessionWorkerProducerProtocol,
                                   public QVReportingSessionWorkerConsumerProtocol,
                                   public RecordingWorker<TestProducerConsumer> {
  public:
    static constexpr std::string_view kClassName = "TestProducerConsumer";
    void stop() override { workerJournal().push_back("stop:TestProducerConsumer"); }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& m) override {
        workerJournal().push_back("handle:TestProducerConsumer:" +
                                  std::string(*m->message().find("audiotag")->asString()));
    }
};

// Resets the journal and every switch.
inline void resetTestWorkers() {
    workerJournal().clear();
    TestOnInitConsumer::switches() = {};
    TestRedundantConsumer::switches() = {};
    TestProducer::switches() = {};
    TestProducerConsumer::switches() = {};
}

}  // namespace qv::test

#include "session/QVReportingWorkerRegistry.h"

#include <gtest/gtest.h>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"
#include "session/TestWorkers.h"
#include "workers/QVReportingWorkerClasses.h"

namespace qv {
namespace {

using test::FakePlatform;
using test::TestOnInitConsumer;
using test::TestProducer;
using test::TestProducerConsumer;
using test::TestRedundantConsumer;
using test::workerJournal;

const QVReportingWorkerClass kNoFactory{"TestWithoutInit", true, false, true, true, false, nullptr};

std::vector<std::string> names(const QVReportingWorkerRegistry::ClassList& classes) {
    std::vector<std::string> out;
    for (const auto* c : classes)
        out.emplace_back(c->name);
    return out;
}

std::shared_ptr<QVReportingSessionMessage> msg(Dictionary payload,
                                               AudioEventCategory c = category::kPlayback,
                                               AudioEventType t = type::kStart) {
    return std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t);
}

class Workers : public ::testing::Test {
  protected:
    void SetUp() override {
        test::resetTestWorkers();
        QVReportingWorkerRegistry::TEST_reset({
            &makeWorkerClass<TestProducer>(),
            &kNoFactory,
            &makeWorkerClass<TestRedundantConsumer>(),
            &makeWorkerClass<TestProducerConsumer>(),
            &makeWorkerClass<TestOnInitConsumer>(),
        });
    }
    void TearDown() override {
        QVReportingWorkerRegistry::TEST_reset({});
        test::resetTestWorkers();
    }
    std::shared_ptr<QVReportingSession> make(bool single = false) {
        auto s = QVReportingSession::initWithID(fake.platform, 9, {77});
        s->setIsSingleMessageSession(single);
        return s;
    }
    template <typename T>
    std::shared_ptr<T> worker(const QVReportingSession& s) {
        for (const auto& w : s.messageWorkers()) {
            if (auto t = std::dynamic_pointer_cast<T>(w))
                return t;
        }
        return nullptr;
    }

    FakePlatform fake;
};

TEST_F(Workers, RegistryDerivesItsListsInOrderAndSkipsClassesWithoutAFactory) {
    test::ScopedMemoryLog log;
    const auto& r = QVReportingWorkerRegistry::shared();
    EXPECT_EQ(r.allWorkerClasses().size(), 5u);
    EXPECT_EQ(names(r.usableWorkerClasses()),
              (std::vector<std::string>{"TestProducer", "TestRedundantConsumer",
                                        "TestProducerConsumer", "TestOnInitConsumer"}));
    EXPECT_EQ(names(r.consumerWorkerClasses()),
              (std::vector<std::string>{"TestRedundantConsumer", "TestProducerConsumer",
                                        "TestOnInitConsumer"}));
    EXPECT_EQ(names(r.producerWorkerClasses()),
              (std::vector<std::string>{"TestProducer", "TestProducerConsumer"}));
    EXPECT_EQ(names(r.startOnInitWorkerClasses()),
              (std::vector<std::string>{"TestOnInitConsumer"}));
    EXPECT_TRUE(log->contains("Worker does not implement initWithSession! TestWithoutInit"));
    EXPECT_EQ(QVReportingSession::getAllWorkerClasses()[1], &kNoFactory);
}

TEST_F(Workers, StartConsumersFirstAndStopProducersFirstSoDerivedMessagesReachConsumers) {
    auto s = make();
    ASSERT_EQ(s->messageWorkers().size(), 1u);  // the start-on-init consumer, made at creation
    EXPECT_TRUE(s->messageWorkers()[0]->started());
    TestProducer::switches().onStop = [](QVReportingSession& session) {
        session.sendMessage(msg({{"derived", 1}}, category::kVolume, type::kSummary));
    };
    s->start();
    EXPECT_EQ(s->workerInstanceCount(), 4u);
    EXPECT_EQ(workerJournal(),
              (std::vector<std::string>{"start:TestRedundantConsumer", "start:TestProducer"}));
    workerJournal().clear();
    s->stop();
    EXPECT_EQ(workerJournal(),
              (std::vector<std::string>{
                  "stop:TestProducer",
                  // consumers in the order they were made: the start-on-init one first
                  "handle:TestOnInitConsumer:VolumeSummary",
                  "handle:TestRedundantConsumer:VolumeSummary",
                  "handle:TestProducerConsumer:VolumeSummary",
                  "stop:TestProducerConsumer",
                  "stop:TestRedundantConsumer",
              }));
    for (const auto& w : s->messageWorkers())
        EXPECT_FALSE(w->started());

    // A restart makes no second worker of a class and starts the stopped ones again.
    workerJournal().clear();
    s->start();
    EXPECT_EQ(s->workerInstanceCount(), 4u);
    EXPECT_EQ(workerJournal(),
              (std::vector<std::string>{"start:TestRedundantConsumer", "start:TestProducer"}));
}

TEST_F(Workers, DeliverRedundantMessagesOnlyToWorkersThatAskAndHonourDestinations) {
    auto s = make();
    s->start();
    workerJournal().clear();
    s->sendMessage(msg({{"a", 1}}));
    s->sendMessage(msg({{"a", 1}}));  // redundant
    auto addressed = msg({{"b", 1}}, category::kOrbit, type::kSummary);
    addressed->setDestinationWorkers({&makeWorkerClass<TestOnInitConsumer>()});
    s->sendMessage(addressed);
    EXPECT_EQ(workerJournal(), (std::vector<std::string>{
                                   "handle:TestOnInitConsumer:PlaybackStart",
                                   "handle:TestRedundantConsumer:PlaybackStart",
                                   "handle:TestProducerConsumer:PlaybackStart",
                                   "handle:TestRedundantConsumer:PlaybackStart",
                                   "handle:TestOnInitConsumer:OrbitSummary",
                               }));
}

TEST_F(Workers, AWorkerThatFailsToStartStaysListedButReceivesNothing) {
    TestRedundantConsumer::switches().startResult = false;
    test::ScopedMemoryLog log;
    auto s = make();
    s->start();
    auto failed = worker<TestRedundantConsumer>(*s);
    ASSERT_TRUE(failed);
    EXPECT_FALSE(failed->started());
    s->sendMessage(msg({{"a", 1}}));
    EXPECT_TRUE(failed->received.empty());
    EXPECT_TRUE(log->contains(
        "QVReportingSessionWorker action=start worker=TestRedundantConsumer started=NO "
        "reporterID=9"));
    // The next start tries it again.
    TestRedundantConsumer::switches().startResult = true;
    s->stop();
    s->start();
    EXPECT_TRUE(failed->started());
}

TEST_F(Workers, AClassThatRefusesTheSessionIsLoggedAndTheNextClassStillMade) {
    TestProducer::switches().refuseSession = true;
    test::ScopedMemoryLog log;
    auto s = make();
    s->start();
    EXPECT_EQ(worker<TestProducer>(*s), nullptr);
    EXPECT_NE(worker<TestRedundantConsumer>(*s), nullptr);
    EXPECT_TRUE(log->contains(
        "QVReportingSessionWorker failed to initialize. action=failure worker=TestProducer "
        "reporterID=9"));
    EXPECT_TRUE(log->contains(
        "QVReportingSessionWorker already initialized. action=skipped worker=TestOnInitConsumer"));
}

TEST_F(Workers, ASingleMessageSessionAddsOnlyClassesThatServeSingleMessages) {
    test::ScopedMemoryLog log;
    auto s = make(/*single=*/true);
    s->start();
    ASSERT_EQ(s->workerInstanceCount(), 1u);
    EXPECT_NE(worker<TestOnInitConsumer>(*s), nullptr);
    EXPECT_TRUE(log->contains(
        "Skipping QVReportingSessionWorker for single message session. action=skipped "
        "worker=TestProducer reporterID=9"));
}

TEST_F(Workers, WorkersHoldTheirSessionWithoutKeepingItAlive) {
    auto s = make();
    s->start();
    auto w = worker<TestProducer>(*s);
    EXPECT_EQ(w->session(), s);
    s.reset();
    EXPECT_EQ(w->session(), nullptr);
}

TEST_F(Workers, RedundancyAfterTheStopSortComparesWithTheNewestByTime) {
    // {v:1} arrives first but is younger than {v:2}: in arrival order {v:2} is the newest, in
    // time order (after the sort at stop) {v:1} is.
    const double now = fake.clock.now();
    std::vector<bool> redundancy;
    TestProducer::switches().onStop = [&](QVReportingSession& session) {
        auto a = msg({{"v", 1}, {"qvreporting_timestamp", now}});
        auto b = msg({{"v", 2}, {"qvreporting_timestamp", now}});
        session.sendMessage(a);
        session.sendMessage(b);
        redundancy = {a->isRedundant(), b->isRedundant()};
    };
    auto s = make();
    s->start();
    s->sendMessage(msg({{"v", 1}, {"qvreporting_timestamp", now - 10}}));
    s->sendMessage(msg({{"v", 2}, {"qvreporting_timestamp", now - 20}}));
    s->stop();
    // Sorted by time the newest is {v:1}, so {v:1} repeats it and {v:2} then differs from it.
    EXPECT_EQ(redundancy, (std::vector<bool>{true, false}));
}

TEST_F(Workers, TheDaemonTableListsOnlyBuiltClassesInTheirFixedOrder) {
    const auto classes = QVReportingAllWorkerClasses();
    ASSERT_FALSE(classes.empty());
    const std::vector<std::string> fixedOrder{"QVReportingSessionTraceWorker",
                                              "QVReportingSessionVolumeMessagesWorker",
                                              "QVReportingSessionOrbitMessagesWorker",
                                              "QVReportingSessionSummaryWorker",
                                              "QVReportingSessionInputMessagesWorker",
                                              "QVReportingSessionMetricsHubWorker",
                                              "QVReportingSessionEnergyLogWorker",
                                              "QVReportingSessionMemoryLogWorker",
                                              "QVReportingSessionMTXWorker",
                                              "QVReportingSessionDriverSnapshotWorker",
                                              "QVReportingSessionSystemMonitorWorker",
                                              "QVReportingSessionICXWorker",
                                              "QVReportingSessionPulsarWorker",
                                              "QVReportingSessionSummaryJsonFileWorker",
                                              "QVReportingSessionAudioRegistrationWorker",
                                              "QVReportingSessionConvoWorker",
                                              "QVReportingSessionIssueFilerWorker"};
    std::size_t last = 0;
    for (const auto* cls : classes) {
        auto it = std::find(fixedOrder.begin(), fixedOrder.end(), cls->name);
        ASSERT_NE(it, fixedOrder.end()) << cls->name;
        const auto place = static_cast<std::size_t>(it - fixedOrder.begin());
        EXPECT_GE(place, last);
        last = place;
        EXPECT_NE(cls->initWithSession, nullptr);
    }
    // The derived-message producers: made at start, never for single-message sessions, and
    // without a start of their own.
    for (const std::string_view name :
         {"QVReportingSessionVolumeMessagesWorker", "QVReportingSessionOrbitMessagesWorker",
          "QVReportingSessionInputMessagesWorker"}) {
        auto it = std::find_if(classes.begin(), classes.end(),
                               [&](const auto* cls) { return cls->name == name; });
        ASSERT_NE(it, classes.end()) << name;
        const auto& producer = **it;
        EXPECT_TRUE(producer.isProducer) << name;
        EXPECT_FALSE(producer.isConsumer || producer.startOnInit ||
                     producer.handleSingleMessageSession || producer.implementsStart)
            << name;
    }
}

}  // namespace
}  // namespace qv

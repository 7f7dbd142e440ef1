#include "session/QVReportingWorkerRegistry.h"

#include <gtest/gtest.h>

#include <functional>

#include "fakes/FakePlatform.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorker.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

// What the test workers did, in order: "start:Name", "stop:Name", "handle:Name:<audiotag>".
using Journal = std::vector<std::string>;
Journal journal;
struct Switches {
    bool consumerStarts = true;
    bool producerRefusesSession = false;
    std::function<void(QVReportingSession&)> onProducerStop;  // may derive messages
} switches;

class TestProducer;

template <typename Self>
class RecordingWorker {
  public:
    static std::shared_ptr<Self> initWithSession(const std::shared_ptr<QVReportingSession>& s) {
        if (std::is_same_v<Self, TestProducer> && switches.producerRefusesSession)
            return nullptr;
        auto worker = std::make_shared<Self>();
        worker->setSession(s);
        return worker;
    }
    void record(std::string_view what) {
        journal.push_back(std::string(what) + ":" + std::string(Self::kClassName));
    }
    void recordHandle(const std::shared_ptr<QVReportingSessionMessage>& m) {
        record("handle");
        journal.back() += ":" + *m->message().find("audiotag")->asString();
    }
};

// Started at session creation and serving single-message sessions.
class TestOnInitConsumer final : public QVReportingSessionWorkerConsumerProtocol,
                                 public RecordingWorker<TestOnInitConsumer> {
  public:
    static constexpr std::string_view kClassName = "TestOnInitConsumer";
    static bool startOnInit() { return true; }
    static bool handleSingleMessageSession() { return true; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& m) override {
        recordHandle(m);
    }
};

class TestRedundantConsumer final : public QVReportingSessionWorkerConsumerProtocol,
                                    public RecordingWorker<TestRedundantConsumer> {
  public:
    static constexpr std::string_view kClassName = "TestRedundantConsumer";
    bool start() override {
        record("start");
        return switches.consumerStarts;
    }
    void stop() override { record("stop"); }
    bool handleRedundantMessages() const override { return true; }
    void handleMessage(const std::shared_ptr<QVReportingSessionMessage>& m) override {
        recordHandle(m);
    }
};

class TestProducer final : public QVReportingSessionWorkerProducerProtocol,
                           public RecordingWorker<TestProducer> {
  public:
    static constexpr std::string_view kClassName = "TestProducer";
    bool start() override {
        record("start");
        return true;
    }
    void stop() override {
        record("stop");
        if (switches.onProducerStop)
            switches.onProducerStop(*session());
    }
};

// A class whose workers cannot be made: the registry must skip it.
const QVReportingWorkerClass kNoFactory{"TestWithoutInit", true, false, true, true, false, nullptr};

using test::message;

class Workers : public ::testing::Test {
  protected:
    void SetUp() override {
        journal.clear();
        switches = {};
        QVReportingWorkerRegistry::TEST_reset({
            &makeWorkerClass<TestProducer>(),
            &kNoFactory,
            &makeWorkerClass<TestRedundantConsumer>(),
            &makeWorkerClass<TestOnInitConsumer>(),
        });
    }
    void TearDown() override { QVReportingWorkerRegistry::TEST_reset({}); }
    std::shared_ptr<QVReportingSession> make(bool single = false) {
        return test::makeSession(fake.platform, {.id = 9, .pids = {77}, .single = single});
    }

    test::FakePlatform fake;
};

TEST_F(Workers, StartConsumersFirstAndStopProducersFirstSoDerivedMessagesReachConsumers) {
    auto s = make();
    ASSERT_EQ(s->messageWorkers().size(), 1u);  // the start-on-init consumer, made at creation
    switches.onProducerStop = [](QVReportingSession& session) {
        session.sendMessage(message({{"derived", 1}}, category::kVolume, type::kSummary));
    };
    s->start();
    EXPECT_EQ(s->workerInstanceCount(), 3u);
    EXPECT_EQ(journal, (Journal{"start:TestRedundantConsumer", "start:TestProducer"}));
    journal.clear();
    s->stop();
    EXPECT_EQ(journal, (Journal{
                           "stop:TestProducer",
                           // consumers in the order they were made
                           "handle:TestOnInitConsumer:VolumeSummary",
                           "handle:TestRedundantConsumer:VolumeSummary",
                           "stop:TestRedundantConsumer",
                       }));

    // A restart makes no second worker of a class.
    journal.clear();
    s->start();
    EXPECT_EQ(s->workerInstanceCount(), 3u);
    EXPECT_EQ(journal, (Journal{"start:TestRedundantConsumer", "start:TestProducer"}));
}

TEST_F(Workers, DeliverRedundantMessagesOnlyToWorkersThatAskAndHonourDestinations) {
    auto s = make();
    s->start();
    journal.clear();
    s->sendMessage(message({{"a", 1}}));
    s->sendMessage(message({{"a", 1}}));  // redundant
    auto addressed = message({{"b", 1}}, category::kOrbit, type::kSummary);
    addressed->setDestinationWorkers({&makeWorkerClass<TestOnInitConsumer>()});
    s->sendMessage(addressed);
    EXPECT_EQ(journal, (Journal{
                           "handle:TestOnInitConsumer:PlaybackStart",
                           "handle:TestRedundantConsumer:PlaybackStart",
                           "handle:TestRedundantConsumer:PlaybackStart",
                           "handle:TestOnInitConsumer:OrbitSummary",
                       }));
}

TEST_F(Workers, SkipClassesThatRefuseTheSessionOrSingleMessagesAndRetryWorkersThatFailedToStart) {
    switches.producerRefusesSession = true;
    switches.consumerStarts = false;
    auto s = make();
    s->start();
    EXPECT_EQ(test::workerOf<TestProducer>(*s), nullptr);
    auto failed = test::workerOf<TestRedundantConsumer>(*s);
    ASSERT_TRUE(failed);
    EXPECT_FALSE(failed->started());
    journal.clear();
    s->sendMessage(message({{"a", 1}}));
    EXPECT_EQ(journal, (Journal{"handle:TestOnInitConsumer:PlaybackStart"}));
    switches.consumerStarts = true;
    s->stop();
    s->start();
    EXPECT_TRUE(failed->started());

    auto single = make(/*single=*/true);
    single->start();
    EXPECT_EQ(single->workerInstanceCount(), 1u);
    EXPECT_NE(test::workerOf<TestOnInitConsumer>(*single), nullptr);
}

TEST_F(Workers, JudgeRedundancyAfterTheStopSortAgainstTheNewestByTime) {
    // {v:1} arrives first but is younger than {v:2}: after the sort at stop it is the newest.
    const double now = fake.clock.now();
    std::vector<bool> redundancy;
    switches.onProducerStop = [&](QVReportingSession& session) {
        auto a = message({{"v", 1}, {"qvreporting_timestamp", now}});
        auto b = message({{"v", 2}, {"qvreporting_timestamp", now}});
        session.sendMessage(a);
        session.sendMessage(b);
        redundancy = {a->isRedundant(), b->isRedundant()};
    };
    auto s = make();
    s->start();
    s->sendMessage(message({{"v", 1}, {"qvreporting_timestamp", now - 10}}));
    s->sendMessage(message({{"v", 2}, {"qvreporting_timestamp", now - 20}}));
    s->stop();
    EXPECT_EQ(redundancy, (std::vector<bool>{true, false}));
}

}  // namespace
}  // namespace qv

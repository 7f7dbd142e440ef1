#include "workers/backends/QVReportingSessionConvoWorker.h"

#include <thread>

#include "session/QVReportingStats.h"
#include "workers/WorkerTestSupport.h"
#include "workers/backends/QVReportingSessionMetricsHubWorker.h"

namespace qv {
namespace {

using Worker = QVReportingSessionConvoWorker;

const std::string kForwardNeverStarted =
    "Session never started. -[QVReportingSessionConvoWorker handleMessage:]_block_invoke";
const std::string kStopNeverStarted =
    "Session never started. -[QVReportingSessionConvoWorker stop]_block_invoke";

using test::keysOf;

class AConvoWorker : public ::testing::Test {
  protected:
    // Nothing may be left for the executor to run after the test's objects go.
    void TearDown() override { run(); }

    std::shared_ptr<QVReportingSession> started(AudioServiceType type, ReporterID id = 42,
                                                std::optional<Dictionary> configuration = {}) {
        auto s = test::makeSession(
            fake.platform,
            {.id = id, .serviceType = type, .configuration = configuration, .start = true});
        run();
        return s;
    }
    void run() { fake.executor.runUntilIdle(); }
    // Runs what is due once forwarded messages have been gathered.
    void deliver() {
        fake.clock.advance(std::chrono::duration<double>(Worker::kForwardingGatherDelay).count());
        run();
    }
    static void send(QVReportingSession& s, Dictionary payload, AudioEventCategory c = 4,
                     AudioEventType t = 18) {
        s.sendMessage(test::message(std::move(payload), c, t));
    }
    // The fake's sessions, copied under its lock.
    std::vector<test::FakeConvoService::Sent> sent(std::size_t session = 0) {
        auto lock = fake.convo.lock();
        return fake.convo.sessions.at(session)->sent;
    }
    int flushes(std::size_t session = 0) {
        auto lock = fake.convo.lock();
        return fake.convo.sessions.at(session)->flushes;
    }
    static std::shared_ptr<Worker> convoWorker(const QVReportingSession& s) {
        return test::workerOf<Worker>(s);
    }

    test::ScopedWorkerClasses<Worker> workerClasses;
    test::FakePlatform fake;
    test::ScopedMemoryLog log;
};

// What a session tells the service, by its service type and configuration, is the Convo
// end-to-end test's; here, the name a single-message session goes by.
TEST_F(AConvoWorker, NamesASingleMessageSessionByItsBareServiceName) {
    auto single = test::makeSession(
        fake.platform, {.id = 1, .serviceType = service::kAlerts, .single = true, .start = true});
    run();
    ASSERT_EQ(fake.convo.sessions.size(), 1u);
    EXPECT_EQ(*fake.convo.sessions[0]->userInfo.find("ServiceName"), Value("alerts"));
}

TEST_F(AConvoWorker, HoldsMessagesDuringTheWaitAndForwardsThemInOrderOnceBackendsAreKnown) {
    fake.convo.holdCompletions = true;
    auto session = started(service::kGeneric);
    const auto worker = convoWorker(*session);
    ASSERT_TRUE(worker && worker->started());
    EXPECT_TRUE(worker->convoReportingQueue().isWaiting());
    send(*session, {{"i", 1}}, category::kPrefixDSP | category::kSetup, type::kSetup);
    send(*session, {{"i", 2}}, category::kPlayback, type::kStart);
    send(*session, {{"i", 3}}, 0xFFFF1234, type::kUnknown);
    run();
    EXPECT_TRUE(sent().empty());
    EXPECT_FALSE(worker->getConvoReportingStartedState());

    // The service answers on a thread of its own.
    std::thread([&] { fake.convo.completePending(std::vector<std::string>{"jsonl", "b"}); }).join();
    EXPECT_TRUE(worker->getConvoReportingStartedState());
    run();
    EXPECT_EQ(sent().size(), 3u) << "held messages go as soon as the wait ends";

    // A live session's messages are gathered a few milliseconds, then go together.
    send(*session, {{"i", 4}}, category::kVolume, type::kState);
    fake.clock.advance(0.004);
    run();
    EXPECT_EQ(sent().size(), 3u);
    fake.clock.advance(0.001);
    run();
    const auto messages = sent();
    ASSERT_EQ(messages.size(), 4u);
    const std::vector<std::pair<std::uint16_t, std::uint16_t>> expected = {
        {8, 5}, {4, 1}, {0x1234, 0xFFFF}, {14, 18}};
    for (std::size_t i = 0; i < messages.size(); ++i) {
        EXPECT_EQ(std::make_pair(messages[i].category, messages[i].type), expected[i]);
        EXPECT_EQ(*messages[i].payload.find("i"), Value(static_cast<int>(i) + 1));
        EXPECT_TRUE(messages[i].payload.contains("audiotag"));
    }

    // An internal build keeps the time stamp; a failed send is one error line.
    test::setInternalBuild(fake.device, true);
    fake.convo.holdCompletions = false;
    auto internal = started(service::kGeneric, 77);
    send(*internal, {{"i", 5}});
    deliver();
    fake.convo.sendError = "disk full";
    send(*internal, {{"i", 6}});
    deliver();
    ASSERT_EQ(sent(1).size(), 1u);
    EXPECT_TRUE(sent(1)[0].payload.contains("qvreporting_timestamp"));
    EXPECT_EQ(log->count("error sending message disk full"), 1u);
}

// (No token and no backends, the other ways the wait fails, the convo end-to-end test takes.)
TEST_F(AConvoWorker, DropsEachMessageAndTheStopWhenTheWaitTimesOut) {
    fake.convo.holdCompletions = true;
    auto session = started(service::kGeneric);
    send(*session, {{"during", 1}});
    fake.clock.advance(8.999);
    run();
    EXPECT_TRUE(convoWorker(*session)->convoReportingQueue().isWaiting());
    fake.clock.advance(0.001);
    run();
    send(*session, {{"after", 1}});
    session->stop();
    run();
    EXPECT_EQ(log->count("timed out waiting for backends"), 1u);
    EXPECT_EQ(log->count(kForwardNeverStarted), 2u);
    EXPECT_EQ(log->count(kStopNeverStarted), 1u);
    EXPECT_TRUE(sent().empty());
    EXPECT_EQ(flushes(), 0) << "a session that never started is not flushed";
    fake.convo.completePending(std::nullopt);  // answered at last
}

TEST_F(AConvoWorker, LetsALateAnswerSetTheFlagsButSendsNothingOnceTheSessionWasDropped) {
    fake.convo.holdCompletions = true;
    auto session = started(service::kGeneric);
    const auto worker = convoWorker(*session);
    fake.clock.advance(9);
    run();
    fake.convo.completePending(std::vector<std::string>{"jsonl"});
    EXPECT_TRUE(worker->getConvoReportingStartedState());
    send(*session, {{"late", 1}});
    session->stop();
    run();
    EXPECT_TRUE(sent().empty());
    EXPECT_EQ(flushes(), 0);
    EXPECT_EQ(log->count(kForwardNeverStarted), 0u) << "forwarded, to no session";
    EXPECT_TRUE(log->contains("sending convo summary event. reporterID=42"));
    EXPECT_FALSE(worker->getConvoReportingStartedState()) << "cleared by the stop";
}

TEST_F(AConvoWorker, SummarisesTheMessagesItWasMeantForThenFlushesAndCloses) {
    auto session = QVReportingSession::initWithID(fake.platform, 42, {1});
    session->setServiceType(service::kTelephony);
    send(*session, {{"before", 1}});  // stored while not running: left out
    session->start();
    run();
    send(*session, {{"a", 1}, {"b", "x"}});
    send(*session, {{"a", 2}});
    auto elsewhere = std::make_shared<QVReportingSessionMessage>(Dictionary{{"a", 99}}, 4, 18);
    elsewhere->setDestinationWorkers({&makeWorkerClass<QVReportingSessionMetricsHubWorker>()});
    session->sendMessage(elsewhere);
    auto addressed = std::make_shared<QVReportingSessionMessage>(Dictionary{{"a", 3}}, 4, 18);
    addressed->setDestinationWorkers({&makeWorkerClass<Worker>()});
    session->sendMessage(addressed);
    const auto worker = convoWorker(*session);
    session->stop();
    run();

    const auto messages = sent();
    ASSERT_EQ(messages.size(), 4u) << "three forwarded, then the summary";
    const auto& summary = messages.back();
    EXPECT_EQ(summary.category, 0xFFFF);
    EXPECT_EQ(summary.type, 0xFFFF);
    EXPECT_EQ(keysOf(summary.payload),
              (std::vector<std::string>{"QV_Session_Summary_Event", "a", "b", "invalid_timestamp",
                                        "audiotag", "HostApplicationDisplayID"}));
    EXPECT_EQ(summary.payload,
              (Dictionary{{"QV_Session_Summary_Event", "2"},
                          {"a", "1,2,3"},
                          {"b", "x"},
                          {"invalid_timestamp", "nil,nil,nil"},
                          {"audiotag", "PlaybackState,PlaybackState,PlaybackState"},
                          {"HostApplicationDisplayID", "Unknown,Unknown,Unknown"}}));
    EXPECT_EQ(flushes(), 1);
    EXPECT_FALSE(worker->getConvoReportingStartedState());

    // Started again: a new Convo session under a new token.
    session->start();
    run();
    EXPECT_EQ(fake.convo.tokensAsked, 2);
    EXPECT_EQ(fake.convo.sessions.size(), 2u);

    // A stop with an empty list sends no summary, yet flushes.
    auto bare = QVReportingSession::initWithID(fake.platform, 50, {1});
    const auto direct = Worker::initWithSession(bare);
    ASSERT_TRUE(direct->start());
    run();
    direct->stop();
    run();
    EXPECT_TRUE(sent(2).empty());
    EXPECT_EQ(flushes(2), 1);
}

TEST_F(AConvoWorker, SurvivesItsSessionAndBoundsAFloodDuringTheWait) {
    setLogLevel(LogLevel::Default);  // sixteen thousand messages need no debug lines
    fake.convo.holdCompletions = true;
    auto session = started(service::kGeneric);
    std::weak_ptr<Worker> watch = convoWorker(*session);
    const auto lostBefore = QVReportingStats::shared().sinkLinesLost("convo");
    const std::size_t flood = Worker::kMaxHeldMessages + 5;
    for (std::size_t i = 0; i < flood; ++i) {
        send(*session, {{"seq", static_cast<std::uint64_t>(i)}});
    }
    EXPECT_EQ(QVReportingStats::shared().sinkLinesLost("convo") - lostBefore, 5u);

    // The session goes while the service has not answered; the answer comes from elsewhere.
    session.reset();
    EXPECT_FALSE(watch.expired()) << "its queued work keeps the worker";
    std::thread([&] { fake.convo.completePending(std::vector<std::string>{"jsonl"}); }).join();
    run();
    const auto messages = sent();
    ASSERT_EQ(messages.size(), Worker::kMaxHeldMessages);
    for (std::size_t i = 0; i < messages.size(); ++i) {
        ASSERT_EQ(*messages[i].payload.find("seq"), Value(static_cast<std::uint64_t>(i)));
    }
    EXPECT_TRUE(watch.expired());

    // A worker gone before its time-out; the answer that comes after touches nothing of it.
    auto other = started(service::kGeneric, 43);
    watch = convoWorker(*other);
    other.reset();
    fake.clock.advance(9);
    run();
    EXPECT_TRUE(watch.expired());
    fake.convo.completePending(std::vector<std::string>{"jsonl"});
    EXPECT_TRUE(log->contains("timed out waiting for backends"));
}

}  // namespace
}  // namespace qv

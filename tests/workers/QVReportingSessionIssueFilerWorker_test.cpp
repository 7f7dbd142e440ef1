#include "workers/diagnostics/QVReportingSessionIssueFilerWorker.h"

#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using Worker = QVReportingSessionIssueFilerWorker;

class AnIssueFilerWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        fake.device.internalBuild = true;
        fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, 3600);
    }

    std::shared_ptr<QVReportingSession> started(ReporterID id = 7) {
        return test::makeSession(fake.platform,
                                 {.id = id, .processName = "vidcalld", .start = true});
    }
    static std::shared_ptr<Worker> workerOf(const QVReportingSession& session) {
        return test::workerOf<Worker>(session);
    }
    // A message stamped secondsFromNow away from the fake clock's now.
    void send(QVReportingSession& session, bool xyError, double secondsFromNow = 0.0) {
        Dictionary payload{{"qvreporting_timestamp", fake.clock.now() + secondsFromNow}};
        payload.set(xyError ? "vcac_invalid_x" : "vcac_position_x", 1.5);
        session.sendMessage(test::message(std::move(payload), 3, 6));
    }
    std::optional<Value> lastRun() {
        return fake.preferences.value(Worker::kDefaultsSuite, Worker::kLastRunKey);
    }

    test::ScopedWorkerClasses<Worker> workerClasses;
    test::FakePlatform fake;
    test::ScopedMemoryLog log;
};

TEST_F(AnIssueFilerWorker, ExistsOnInternalBuildsWithTheBackOffSetAndServesSingleMessageSessions) {
    auto session = started(7);
    auto worker = workerOf(*session);
    ASSERT_TRUE(worker);
    EXPECT_EQ(worker->backOffTime(), 3600.0);

    // A setting written as text still gives a worker, with its leading number.
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, "60 seconds");
    auto single = test::makeSession(fake.platform, {.id = 8, .single = true, .start = true});
    ASSERT_TRUE(workerOf(*single));
    EXPECT_EQ(workerOf(*single)->backOffTime(), 60.0);

    fake.preferences.removeValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey);
    EXPECT_FALSE(workerOf(*started(9)));

    // A customer build never gets one, setting or not.
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, 3600);
    test::setInternalBuild(fake.device, false);
    EXPECT_FALSE(workerOf(*started(10)));
}

TEST_F(AnIssueFilerWorker, WaitsOutTheGracePeriodThenAsksForOneDraftPerSession) {
    auto session = started();
    send(*session, false);  // opens the grace period: errors up to 5 s later are ignored
    send(*session, true, 5.0);
    EXPECT_EQ(fake.issueFiler.count(), 0u);
    EXPECT_FALSE(lastRun()) << "a message inside the grace period never asks the back-off";

    send(*session, true, 5.001);
    ASSERT_EQ(fake.issueFiler.count(), 1u);  // (for its process: the prompt's end-to-end test)
    ASSERT_TRUE(lastRun());
    EXPECT_EQ(lastRun()->doubleValue(), fake.clock.now()) << "written when the question is asked";

    // Within the back-off the next error is not even of interest; other messages never are.
    send(*session, true, 30.0);
    send(*session, false, 40.0);
    EXPECT_EQ(fake.issueFiler.count(), 1u);

    // A failed draft is logged as such.
    session->stop();
    fake.issueFiler.error = "tracker unreachable";
    fake.clock.advance(3601);
    session->start();
    send(*session, true, 10.0);
    EXPECT_EQ(fake.issueFiler.count(), 2u);
    EXPECT_TRUE(log->contains("Error creating draft - tracker unreachable"));
}

TEST_F(AnIssueFilerWorker, AsksOncePerBackOffAcrossSessionsAndOncePerSessionRun) {
    auto first = started(1);
    send(*first, false);
    send(*first, true, 6.0);
    ASSERT_EQ(fake.issueFiler.count(), 1u);
    const double firstRun = lastRun()->doubleValue();

    // A second session within the back-off asks nothing, up to its last instant.
    fake.clock.setNow(firstRun + 3599.5);
    auto second = started(2);
    send(*second, false);
    send(*second, true, 6.0);
    EXPECT_EQ(fake.issueFiler.count(), 1u);
    EXPECT_EQ(lastRun()->doubleValue(), firstRun) << "a refusal writes nothing";

    // At exactly the back-off the last run no longer counts (it must be later than now - B).
    fake.clock.setNow(firstRun + 3600.0);
    auto third = started(3);
    send(*third, false);
    send(*third, true, 6.0);
    EXPECT_EQ(fake.issueFiler.count(), 2u);
    EXPECT_EQ(lastRun()->doubleValue(), firstRun + 3600.0);

    // Without a back-off only hasRun keeps a session to one draft, until it stops.
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, 0);
    auto fourth = started(4);
    send(*fourth, false);
    fake.clock.advance(1);
    send(*fourth, true, 6.0);
    fake.clock.advance(1);
    send(*fourth, true, 7.0);
    EXPECT_EQ(fake.issueFiler.count(), 3u);
    fourth->stop();
    fourth->start();
    fake.clock.advance(1);
    send(*fourth, true, 8.0);
    EXPECT_EQ(fake.issueFiler.count(), 4u) << "the grace period opens only once per worker";

    // A last run stored as something other than a number reads as never.
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, 3600);
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kLastRunKey, "yesterday");
    auto fifth = started(5);
    send(*fifth, false);
    send(*fifth, true, 6.0);
    EXPECT_EQ(fake.issueFiler.count(), 5u);
}

}  // namespace
}  // namespace qv

#include "workers/diagnostics/QVReportingSessionIssueFilerWorker.h"

#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {
namespace {

using Worker = QVReportingSessionIssueFilerWorker;

class AnIssueFilerWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        QVReportingUtilityTEST_resetInternalBuild();
        QVReportingWorkerRegistry::TEST_reset({&makeWorkerClass<Worker>()});
        fake.device.internalBuild = true;
        fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, 3600);
    }
    void TearDown() override {
        QVReportingWorkerRegistry::TEST_reset({});
        QVReportingUtilityTEST_resetInternalBuild();
    }

    std::shared_ptr<QVReportingSession> started(ReporterID id = 7) {
        auto session = QVReportingSession::initWithID(fake.platform, id, {1234});
        session->setClientProcessName("vidcalld");
        session->start();
        return session;
    }
    static std::shared_ptr<Worker> workerOf(const QVReportingSession& session) {
        for (const auto& w : session.messageWorkers()) {
            if (auto issueFiler = std::dynamic_pointer_cast<Worker>(w)) {
                return issueFiler;
            }
        }
        return nullptr;
    }
    // A message stamped secondsFromNow away from the fake clock's now.
    void send(QVReportingSession& session, bool xyError, double secondsFromNow = 0.0) {
        Dictionary payload{{"qvreporting_timestamp", fake.clock.now() + secondsFromNow}};
        payload.set(xyError ? "vcac_invalid_x" : "vcac_position_x", 1.5);
        session.sendMessage(std::make_shared<QVReportingSessionMessage>(std::move(payload), 3, 6));
    }
    std::optional<Value> lastRun() {
        return fake.preferences.value(Worker::kDefaultsSuite, Worker::kLastRunKey);
    }

    test::FakePlatform fake;
    test::ScopedMemoryLog log;
};

TEST_F(AnIssueFilerWorker, ExistsOnInternalBuildsWithTheBackOffSetAndServesSingleMessageSessions) {
    auto session = started(7);
    auto worker = workerOf(*session);
    ASSERT_TRUE(worker);
    EXPECT_EQ(worker->backOffTime(), 3600.0);
    EXPECT_EQ(worker->minimumMessageTime(), -1.0);
    EXPECT_FALSE(worker->hasRun());

    // A setting written as text still gives a worker, with its leading number.
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, "60 seconds");
    auto single = QVReportingSession::initWithID(fake.platform, 8, {1234});
    single->setIsSingleMessageSession(true);
    single->start();
    ASSERT_TRUE(workerOf(*single));
    EXPECT_EQ(workerOf(*single)->backOffTime(), 60.0);

    fake.preferences.removeValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey);
    EXPECT_FALSE(workerOf(*started(9)));
    EXPECT_TRUE(log->contains(
        "VidcallInvalidXyBackOffSeconds default not set. Skipping worker. reporterID=9"));

    // A customer build never gets one, setting or not.
    fake.preferences.setValue(Worker::kDefaultsSuite, Worker::kBackOffSecondsKey, 3600);
    QVReportingUtilityTEST_resetInternalBuild();
    fake.device.internalBuild = false;
    EXPECT_FALSE(workerOf(*started(10)));
}

TEST_F(AnIssueFilerWorker, WaitsOutTheGracePeriodThenAsksForOneDraftPerSession) {
    auto session = started();
    send(*session, false);  // opens the grace period: errors up to 5 s later are ignored
    send(*session, true, 5.0);
    EXPECT_EQ(fake.issueFiler.count(), 0u);
    EXPECT_FALSE(lastRun()) << "a message inside the grace period never asks the back-off";

    send(*session, true, 5.001);
    ASSERT_EQ(fake.issueFiler.count(), 1u);
    const auto& request = fake.issueFiler.requests[0];
    EXPECT_EQ(request.processName, "vidcalld");
    EXPECT_EQ(request.displayReason, "a Vidcall spatial positioning error occurred");
    const IssueDraft& draft = request.draft;
    EXPECT_EQ(draft.title, "Invalid x/y coordinates during a Vidcall call (ITF)");
    EXPECT_EQ(draft.problemDescription,
              "Invalid coordinates were provided to the audio layer during a Vidcall call, making "
              "it impossible to render spatial audio correctly. Filing this tracker will help "
              "determine what went wrong.");
    EXPECT_EQ(draft.component.name, "Vidcall Core - Callwire");
    EXPECT_EQ(draft.component.version, "All");
    EXPECT_GT(draft.component.identifier, 0);
    EXPECT_EQ(draft.reproducibility, 6);
    EXPECT_EQ(draft.classification, 7);
    EXPECT_EQ(draft.diagnosticExtensionIdentifiers,
              std::vector<std::string>{"com.korvane.DiagnosticExtensions.audio"});
    EXPECT_TRUE(log->contains("Starting issue filer for VidcallXYerrorMessage reporterID=7"));
    EXPECT_TRUE(log->contains("Successfully created draft"));
    ASSERT_TRUE(lastRun());
    EXPECT_EQ(lastRun()->doubleValue(), fake.clock.now()) << "written when the question is asked";

    // Within the back-off the next error is not even of interest; other messages never are.
    send(*session, true, 30.0);
    send(*session, false, 40.0);
    EXPECT_EQ(fake.issueFiler.count(), 1u);
    EXPECT_TRUE(log->contains("Issue filer has run. key=VidcallInvalidXyITFlastRun lastRun="));

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
    EXPECT_TRUE(
        log->contains("Issue filer has already run for VidcallXYerrorMessage reporterID=4"));
    fourth->stop();
    EXPECT_FALSE(workerOf(*fourth)->hasRun());
    EXPECT_TRUE(log->contains("Resetting hasRun to false. reporterID=4"));
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

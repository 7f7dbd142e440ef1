#include "platform/linux/capture/LinuxIssueCaptureService.h"

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <unistd.h>

#include <cmath>
#include <fstream>
#include <future>
#include <limits>
#include <string>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/FakeServices.h"
#include "fakes/FileSizeLimit.h"
#include "fakes/Notes.h"
#include "fakes/SinkLines.h"
#include "fakes/TempDirectory.h"
#include "platform/linux/capture/IssueCaptureCollector.h"

namespace qv {
namespace {

namespace fs = std::filesystem;

class ALinuxIssueCaptureService : public ::testing::Test {
  protected:
    ALinuxIssueCaptureService() { start(); }

    void start(std::optional<std::string> capturesDirectory = std::nullopt) {
        service.reset();
        service = std::make_unique<LinuxIssueCaptureService>(
            clock, preferences,
            std::make_unique<JsonlSink>(state.path().string(), "issuecapture", clock,
                                        SinkCallbacks{}),
            LinuxIssueCaptureService::Options{capturesDirectory.value_or(captures().string()),
                                              (state / "no-journal-here").string(), ::getpid()},
            LinuxIssueCaptureService::Callbacks{
                [this](std::string_view reason) { refused.add(reason); }, problems.callback()});
        reporter = service->createReporter();
    }

    fs::path captures() const { return state / "logs/Audio/Captures"; }

    Dictionary signature(const std::string& subtype, const std::string& process = "Unknown") {
        return reporter->makeSignature("AudioAnalytics", "haptics", subtype, "EnergyLog", process,
                                       std::nullopt);
    }

    // Asks and waits for the service to have handled the request; the reply it gave.
    Dictionary snapshot(const Dictionary& sig, std::optional<Dictionary> payload = std::nullopt) {
        return ask(false, sig, 0.0, std::move(payload));
    }
    Dictionary session(const Dictionary& sig, double duration) {
        return ask(true, sig, duration, std::nullopt);
    }
    Dictionary ask(bool timed, const Dictionary& sig, double duration,
                   std::optional<Dictionary> payload) {
        auto answer = std::make_shared<std::promise<Dictionary>>();
        auto reply = [answer](const Dictionary& r) { answer->set_value(r); };
        const bool accepted =
            timed ? reporter->startSessionWithSignature(sig, duration, std::nullopt, payload,
                                                        std::nullopt, reply)
                  : reporter->snapshotWithSignature(sig, duration, std::nullopt, payload, reply);
        EXPECT_TRUE(accepted);
        service->flush();
        return answer->get_future().get();
    }
    static std::optional<std::int64_t> reason(const Dictionary& reply) {
        if (const Value* ok = reply.find(kIssueCaptureReplySuccess); ok && ok->boolValue()) {
            return std::nullopt;
        }
        return reply.find(kIssueCaptureReplyReason)->asInt64();
    }
    static std::string id(const Dictionary& reply) {
        return *reply.find(kIssueCaptureReplySessionID)->asString();
    }
    nlohmann::json manifest(const std::string& captureID) {
        std::ifstream in(captures() / captureID / "manifest.json");
        return nlohmann::json::parse(in, nullptr, false);
    }
    std::vector<nlohmann::ordered_json> sinkLines(std::string_view op) {
        service->flush();
        return test::readSinkLines(state / "sinks/issuecapture.jsonl", op);
    }
    void set(std::string_view key, Value value) {
        preferences.setValue(LinuxIssueCaptureService::kSuite, key, value);
    }

    test::TempDirectory state{"qvicx"};
    test::FakeClock clock;
    test::FakePreferenceStore preferences;
    test::Notes refused;
    test::Notes problems;
    std::unique_ptr<LinuxIssueCaptureService> service;
    std::shared_ptr<IssueCaptureReporter> reporter;
};

TEST_F(ALinuxIssueCaptureService, KeepsTheDailyLimitOverARollingDayAcrossRestarts) {
    set(LinuxIssueCaptureService::kDailyLimitKey, 3);
    for (int n = 0; n < 3; ++n) {
        EXPECT_EQ(reason(snapshot(signature(fmt::format("S{}", n)))), std::nullopt);
        clock.advance(3600);
    }
    EXPECT_EQ(reason(snapshot(signature("S9"))), kIssueCaptureErrorDailyLimitExceeded);
    // A restarted service counts the captures it finds on disk.
    start();
    EXPECT_EQ(reason(snapshot(signature("S9"))), kIssueCaptureErrorDailyLimitExceeded);
    clock.advance(86400 - 3 * 3600 + 1);  // the first capture is a day old
    EXPECT_EQ(reason(snapshot(signature("S9"))), std::nullopt);
    EXPECT_EQ(reason(snapshot(signature("S10"))), kIssueCaptureErrorDailyLimitExceeded);
    set(LinuxIssueCaptureService::kEnabledKey, false);
    EXPECT_EQ(reason(snapshot(signature("S11"))), kIssueCaptureErrorNotSupported);

    EXPECT_EQ(std::distance(fs::directory_iterator(captures()), fs::directory_iterator()), 4);
}

TEST_F(ALinuxIssueCaptureService, TakesOneCapturePerSignatureInTheInterval) {
    EXPECT_EQ(reason(snapshot(signature("A"))), std::nullopt);
    clock.advance(599.5);
    EXPECT_EQ(reason(snapshot(signature("A"))), kIssueCaptureErrorRequestThrottled);
    EXPECT_EQ(reason(snapshot(signature("B"))), std::nullopt) << "another signature";
    EXPECT_EQ(reason(session(signature("A"), 60)), kIssueCaptureErrorRequestThrottled);
    clock.advance(0.5);
    EXPECT_EQ(reason(snapshot(signature("A"))), std::nullopt);
    // A shorter interval applies from the signature's next capture on.
    set(LinuxIssueCaptureService::kSignatureIntervalKey, 5);
    EXPECT_EQ(reason(snapshot(signature("A"))), kIssueCaptureErrorRequestThrottled);
    clock.advance(600);
    EXPECT_EQ(reason(snapshot(signature("A"))), std::nullopt);
    clock.advance(5);
    EXPECT_EQ(reason(snapshot(signature("A"))), std::nullopt);

    // Requests refused for their signature leave no line; every accepted one has its two.
    const auto requests = sinkLines("snapshot");
    const auto replies = sinkLines("reply");
    ASSERT_EQ(requests.size(), 5u);
    ASSERT_EQ(replies.size(), 5u);
    for (std::size_t i = 0; i < requests.size(); ++i) {
        EXPECT_EQ(requests[i]["sessionID"], replies[i]["sessionID"]);
        EXPECT_EQ(replies[i]["reply"]["success"], true);
    }
    EXPECT_EQ(std::ranges::count(refused.lines(), "kIssueCaptureErrorRequestThrottled"), 3);
}

TEST_F(ALinuxIssueCaptureService, RefusesARequestQueuedBehindTheCaptureOfItsSignature) {
    // The second request may reach the thread before the first is decided, or be turned away
    // at the door after it: either way it is refused for its signature.
    std::promise<Dictionary> first, second;
    ASSERT_TRUE(reporter->snapshotWithSignature(signature("Q"), 0, std::nullopt, std::nullopt,
                                                [&](const Dictionary& r) { first.set_value(r); }));
    ASSERT_TRUE(reporter->snapshotWithSignature(signature("Q"), 0, std::nullopt, std::nullopt,
                                                [&](const Dictionary& r) { second.set_value(r); }));
    service->flush();
    EXPECT_EQ(reason(first.get_future().get()), std::nullopt);
    EXPECT_EQ(reason(second.get_future().get()), kIssueCaptureErrorRequestThrottled);
}

TEST_F(ALinuxIssueCaptureService, CollectsATimedSessionWhenItsTimeHasPassedUnlessCancelled) {
    set(LinuxIssueCaptureService::kDailyLimitKey, 2);
    const std::string kept = id(session(signature("Error", "alarmd"), 60));
    const std::string cancelled = id(session(signature("Other", "alarmd"), 60));
    EXPECT_EQ(service->pendingSessionCount(), 2u);
    EXPECT_EQ(reason(snapshot(signature("Third"))), kIssueCaptureErrorDailyLimitExceeded);

    reporter->cancelSession(cancelled);
    reporter->cancelSession("no-such-capture");
    clock.advance(59.5);
    service->flush();
    EXPECT_FALSE(fs::exists(captures() / kept)) << "not before its time";
    EXPECT_EQ(service->pendingSessionCount(), 1u);
    clock.advance(0.5);
    service->flush();
    EXPECT_EQ(service->pendingSessionCount(), 0u);
    const auto m = manifest(kept);
    EXPECT_EQ(m["kind"], "session");
    EXPECT_EQ(m["id"], kept);
    EXPECT_EQ(m["signature"]["detectedProcess"], "alarmd");
    EXPECT_FALSE(fs::exists(captures() / cancelled));
    // The cancelled session gave its place in the day back.
    EXPECT_EQ(reason(snapshot(signature("Third"))), std::nullopt);

    reporter->cancelSession(kept);  // already collected
    const auto replies = sinkLines("reply");
    std::vector<nlohmann::json> cancels;
    for (const auto& r : replies) {
        if (r["request"] == "cancel") {
            cancels.push_back(r);
        }
    }
    ASSERT_EQ(cancels.size(), 3u);
    EXPECT_EQ(cancels[0]["reply"]["success"], true);
    EXPECT_EQ(cancels[1]["sessionID"], "no-such-capture");
    EXPECT_EQ(cancels[1]["reply"]["reason"], kIssueCaptureErrorSessionNotFound);
    EXPECT_EQ(cancels[2]["reply"]["reason"], kIssueCaptureErrorSessionNotFound);
    EXPECT_EQ(sinkLines("cancel").size(), 3u);
}

TEST_F(ALinuxIssueCaptureService, CollectsTheStatusOfLiveProcessesAndSaysWhatItCouldNot) {
    const std::int64_t self = ::getpid();
    const Dictionary payload{{std::string(kIssueCaptureKeyPayloadDEParameters),
                              Dictionary{{"com.korvane.EnergylogCore.DESysLogFilterProcess",
                                          Dictionary{{"processIDs", Array{self, -3, "1", 4194303,
                                                                          std::nan(""), self}}}}}}};
    const auto reply = snapshot(signature("Playback"), payload);
    ASSERT_EQ(reason(reply), std::nullopt);
    const std::string captureID = id(reply);
    const auto m = manifest(captureID);
    ASSERT_TRUE(m.is_object());
    // The status file's contents are the end-to-end test's part; here, what cannot be read.
    EXPECT_EQ(m["processIDs"], (nlohmann::json{self, 4194303}));

    std::vector<std::string> missing;
    for (const auto& n : m["notCollected"]) {
        missing.push_back(n["what"].get<std::string>() + ": " + n["why"].get<std::string>());
    }
    const auto has = [&](const std::string& text) {
        return std::any_of(missing.begin(), missing.end(),
                           [&](const std::string& m) { return m.find(text) != std::string::npos; });
    };
    EXPECT_TRUE(has("processIDs[1]: not a process ID"));
    EXPECT_TRUE(has("processIDs[2]: not a process ID"));
    EXPECT_TRUE(has("processIDs[4]: not a process ID"));
    EXPECT_TRUE(has("/proc/4194303/status: no such process"));
    EXPECT_TRUE(has("journal: cannot open the journal"));
    EXPECT_FALSE(fs::exists(captures() / captureID / "journal.txt"));
    EXPECT_EQ(m["journal"]["source"], (state / "no-journal-here").string());

    // Found by name when the payload names no process.
    const auto byName = snapshot(signature("Named", "no-such-proc-xyz"));
    const auto named = manifest(id(byName));
    EXPECT_EQ(named["processName"], "no-such-proc-xyz");
    EXPECT_TRUE(named["processIDs"].empty());
}

TEST_F(ALinuxIssueCaptureService, RefusesBadParametersAndSurvivesAnUnwritableDirectory) {
    const auto nothing = [](const Dictionary&) { ADD_FAILURE() << "no reply expected"; };
    EXPECT_FALSE(reporter->snapshotWithSignature(signature("A"), std::nan(""), std::nullopt,
                                                 std::nullopt, nothing));
    EXPECT_FALSE(reporter->startSessionWithSignature(signature("A"), -1, std::nullopt, std::nullopt,
                                                     std::nullopt, nothing));
    EXPECT_FALSE(
        reporter->startSessionWithSignature(signature("A"), std::numeric_limits<double>::infinity(),
                                            std::nullopt, std::nullopt, std::nullopt, nothing));
    EXPECT_FALSE(reporter->snapshotWithSignature(Dictionary{{"domain", 3}}, 0, std::nullopt,
                                                 std::nullopt, nothing));

    // Captures under a regular file cannot be made: the request is still answered, the problem
    // reported, and the service goes on.
    std::ofstream(state / "blocker") << "x";
    start((state / "blocker" / "Captures").string());
    EXPECT_EQ(reason(snapshot(signature("A"))), std::nullopt);
    EXPECT_EQ(reason(snapshot(signature("B"))), std::nullopt);
    const auto said = problems.lines();
    ASSERT_EQ(said.size(), 2u);
    EXPECT_NE(said[0].find("cannot make"), std::string::npos) << said[0];
}

TEST_F(ALinuxIssueCaptureService, BoundsTheRequestsWaitingForItsThreadAndItsPendingSessions) {
    set(LinuxIssueCaptureService::kDailyLimitKey, 1000);
    // The first reply holds the service's thread until the test lets it go.
    std::promise<void> release;
    std::shared_future<void> released = release.get_future().share();
    std::promise<void> holding;
    ASSERT_TRUE(reporter->snapshotWithSignature(signature("hold"), 0, std::nullopt, std::nullopt,
                                                [&](const Dictionary&) {
                                                    holding.set_value();
                                                    released.wait();
                                                }));
    holding.get_future().wait();
    std::atomic<int> answered{0};
    for (std::size_t n = 0; n < LinuxIssueCaptureService::kMaxQueuedRequests; ++n) {
        ASSERT_TRUE(reporter->startSessionWithSignature(signature(fmt::format("q{}", n)), 60,
                                                        std::nullopt, std::nullopt, std::nullopt,
                                                        [&](const Dictionary&) { ++answered; }));
    }
    EXPECT_EQ(answered.load(), 0);
    std::optional<Dictionary> overflow;
    ASSERT_TRUE(reporter->snapshotWithSignature(signature("over"), 0, std::nullopt, std::nullopt,
                                                [&](const Dictionary& r) { overflow = r; }));
    ASSERT_TRUE(overflow) << "answered at once, on the caller's thread";
    EXPECT_EQ(reason(*overflow), kIssueCaptureErrorServiceUnavailable);
    release.set_value();
    service->flush();
    EXPECT_EQ(answered.load(), static_cast<int>(LinuxIssueCaptureService::kMaxQueuedRequests));
    EXPECT_EQ(service->pendingSessionCount(), LinuxIssueCaptureService::kMaxPendingSessions);
    EXPECT_EQ(std::ranges::count(refused.lines(), "kIssueCaptureErrorServiceUnavailable"),
              static_cast<long>(LinuxIssueCaptureService::kMaxQueuedRequests -
                                LinuxIssueCaptureService::kMaxPendingSessions + 1));
}

// A disk that fills up in the middle of a capture.
TEST(AnIssueCapture, ThatCannotBeWrittenWholeSaysSoAndLeavesNoHalfManifest) {
    test::TempDirectory dir{"qvcapture"};
    IssueCaptureJob job;
    job.id = "full";
    job.kind = "snapshot";
    job.signature = Dictionary{{"detectedProcess", "Unknown"}};
    job.payload = Dictionary{
        {std::string(kIssueCaptureKeyPayloadDEParameters),
         Dictionary{
             {"x", Dictionary{{"processIDs", Array{static_cast<std::int64_t>(::getpid())}}}}}}};
    job.directory = dir / "full";
    job.journalDirectory = (dir / "none").string();
    IssueCaptureOutcome outcome;
    {
        test::FileSizeLimit limit(64);
        outcome = QVReportingCollectIssueCapture(job, 1.0);
    }
    EXPECT_FALSE(outcome.manifestWritten);
    EXPECT_FALSE(fs::exists(job.directory / "manifest.json"));
    EXPECT_FALSE(fs::exists(job.directory / "manifest.json.tmp"));
    ASSERT_GE(outcome.problems.size(), 2u);  // the status file and the manifest
    EXPECT_NE(outcome.problems[0].find("status-"), std::string::npos) << outcome.problems[0];
    bool noted = false;
    for (const auto& n : outcome.manifest["notCollected"]) {
        noted = noted || n["why"].get<std::string>().starts_with("writing status-");
    }
    EXPECT_TRUE(noted);
}

}  // namespace
}  // namespace qv

#include "workers/diagnostics/QVReportingSessionPulsarWorker.h"

#include <chrono>
#include <cmath>

#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using Worker = QVReportingSessionPulsarWorker;
constexpr AudioEventCategory kIO = 7;
constexpr AudioEventType kError = 6;

class APulsarWorker : public ::testing::Test {
  protected:
    void SetUp() override {
        Worker::TEST_resetSettings();
        Worker::TEST_setPause([this](std::chrono::microseconds d) { pauses.push_back(d); });
        fake.device.internalBuild = true;
        setting(Worker::kEnableKey, true);
        // Counts posts of the notification, and notes whether each request came before it.
        fake.notifications.registerNotification(
            Worker::kDroppedSpinlogNotification, [](std::function<void()> task) { task(); },
            [this](NotificationCenter::Token) { ++posts; });
        fake.diagnostics.onRequest = [this] { postsAtRequest.push_back(posts); };
    }
    void TearDown() override {
        Worker::TEST_setPause(nullptr);
        Worker::TEST_resetSettings();
    }

    void setting(std::string_view key, const Value& value) {
        fake.preferences.setValue(Worker::kDefaultsSuite, key, value);
    }
    std::shared_ptr<QVReportingSession> started(ReporterID id = 7) {
        return test::makeSession(
            fake.platform, {.id = id,
                            .configuration = {{{"KXHostApplicationDisplayID", "com.example.daw"}}},
                            .start = true});
    }
    static bool hasWorker(const QVReportingSession& session) {
        return session.workerInstanceCount() == 1;
    }
    void overload(QVReportingSession& session, const Value& frames, Dictionary extra = {},
                  AudioEventCategory category = kIO, AudioEventType type = kError) {
        Dictionary payload{{"smallest_buffer_frame_size", frames}};
        payload.merge(extra);
        session.sendMessage(test::message(std::move(payload), category, type));
    }

    test::ScopedWorkerClasses<Worker> workerClasses;
    test::FakePlatform fake;
    test::ScopedMemoryLog log;
    std::vector<std::chrono::microseconds> pauses;
    int posts = 0;
    std::vector<int> postsAtRequest;
};

TEST_F(APulsarWorker, ExistsOnlyOnInternalBuildsWithSpinlogsEnabled) {
    EXPECT_TRUE(hasWorker(*started(1)));
    setting(Worker::kEnableKey, "YES");
    EXPECT_TRUE(hasWorker(*started(2)));
    setting(Worker::kEnableKey, "NO");
    EXPECT_FALSE(hasWorker(*started(3)));
    setting(Worker::kEnableKey, Array{Value(true)});
    EXPECT_FALSE(hasWorker(*started(4))) << "a container is no switch";
    fake.preferences.removeValue(Worker::kDefaultsSuite, Worker::kEnableKey);
    EXPECT_FALSE(hasWorker(*started(5)));

    setting(Worker::kEnableKey, true);
    test::setInternalBuild(fake.device, false);
    EXPECT_FALSE(hasWorker(*started(6)));

    // Single-message sessions are not served.
    test::setInternalBuild(fake.device, true);
    EXPECT_FALSE(
        hasWorker(*test::makeSession(fake.platform, {.id = 8, .single = true, .start = true})));
}

TEST_F(APulsarWorker, RequestsAQualifyingOverloadAtMostEveryTenSecondsThenNotifies) {
    auto session = started();
    overload(*session, 256);
    EXPECT_EQ(fake.diagnostics.count(), 0u);

    const Dictionary nested{{"thread", "io"}};
    overload(*session, 1024, {{"context", nested}});
    ASSERT_EQ(fake.diagnostics.count(), 1u);
    const auto& request = fake.diagnostics.requests[0];
    const auto& stored = session->messages().back()->message();
    EXPECT_EQ(request.payload, stored);
    EXPECT_NE(request.payload.find("context")->asDictionary(),
              stored.find("context")->asDictionary())
        << "the request holds a deep copy";
    EXPECT_EQ(posts, 1);
    EXPECT_EQ(postsAtRequest, std::vector<int>{0}) << "the request comes before the notification";
    EXPECT_EQ(pauses, std::vector<std::chrono::microseconds>{std::chrono::microseconds(0)});
    const double firstTime = fake.clock.now();
    EXPECT_EQ(std::dynamic_pointer_cast<Worker>(session->messageWorkers()[0])->lastMessageTime(),
              firstTime);

    // 5 s and exactly 10 s later: too soon. 11 s later: asked again, and notified again.
    fake.clock.advance(5);
    overload(*session, 2048, {{"n", 2}});
    fake.clock.advance(5);
    overload(*session, 2048, {{"n", 3}});
    EXPECT_EQ(fake.diagnostics.count(), 1u);
    fake.clock.advance(1);
    overload(*session, 2048, {{"n", 4}});
    EXPECT_EQ(fake.diagnostics.count(), 2u);
    EXPECT_EQ(posts, 2);
    EXPECT_EQ(postsAtRequest, (std::vector<int>{0, 1}));

    // (Spacing per session: the overloads' end-to-end flood.) Neither an error of another category
    // nor another type of I/O message is of interest.
    fake.clock.advance(20);
    overload(*session, 4096, {}, 11, kError);
    overload(*session, 4096, {}, kIO, 1);
    EXPECT_EQ(fake.diagnostics.count(), 2u);
}

TEST_F(APulsarWorker, ReadsPayloadValuesOfAnyKindAsIntegers) {
    auto session = started();
    struct Case {
        Value frames;
        bool requested;
    };
    const Case cases[] = {
        {Value("1024 frames"), true}, {Value(512.9), true},
        {Value("abc"), false},        {Value(true), false},
        {Value(std::nan("")), false}, {Value(Array{Value(4096)}), false},
    };
    std::size_t expected = 0;
    for (const auto& c : cases) {
        fake.clock.advance(11);
        overload(*session, c.frames, {{"seq", static_cast<std::int64_t>(expected)}});
        expected += c.requested ? 1 : 0;
        EXPECT_EQ(fake.diagnostics.count(), expected) << c.frames.description();
    }

    // No "smallest_buffer_frame_size" at all reads as 0; no application name prints "(null)".
    auto worker = std::dynamic_pointer_cast<Worker>(session->messageWorkers()[0]);
    fake.clock.advance(11);
    worker->handleMessage(std::make_shared<QVReportingSessionMessage>(Dictionary{}, kIO, kError));
    EXPECT_EQ(fake.diagnostics.count(), expected);
    worker->handleMessage(std::make_shared<QVReportingSessionMessage>(
        Dictionary{{"smallest_buffer_frame_size", 1024}}, kIO, kError));
    ASSERT_EQ(fake.diagnostics.count(), expected + 1);
    EXPECT_EQ(fake.diagnostics.requests.back().description, "(null)");
}

TEST_F(APulsarWorker, TakesItsProcessWideSettingsFromTheLastWorkerMade) {
    setting(Worker::kIOBufferSizeKey, "256");
    setting(Worker::kIOCycleKey, 3);
    setting(Worker::kWaitTimeKey, 1500.7);
    auto session = started();

    overload(*session, 256, {{"io_cycle", 2}});
    EXPECT_EQ(fake.diagnostics.count(), 0u);
    overload(*session, 256, {{"io_cycle", "3 cycles"}});
    EXPECT_EQ(fake.diagnostics.count(), 1u);
    EXPECT_EQ(pauses.back(), std::chrono::microseconds(1500));

    // A new worker's settings govern the old one too: 0 means 512; a huge pause is capped, and a
    // negative or NaN one is none.
    setting(Worker::kIOBufferSizeKey, 0);
    fake.preferences.removeValue(Worker::kDefaultsSuite, Worker::kIOCycleKey);
    setting(Worker::kWaitTimeKey, 1e12);
    started(9);
    EXPECT_EQ(Worker::settings().ioBufferSize, 512);
    EXPECT_EQ(Worker::settings().ioCycle, 0);
    EXPECT_TRUE(log->contains("wait_time of 1000000000000 microseconds capped at 250000"));
    fake.clock.advance(11);
    overload(*session, 256);
    EXPECT_EQ(fake.diagnostics.count(), 1u);
    overload(*session, 512);
    EXPECT_EQ(fake.diagnostics.count(), 2u);
    EXPECT_EQ(pauses.back(), std::chrono::microseconds(Worker::kMaximumWaitMicroseconds));

    for (const Value& wait : {Value(-5.0), Value(std::nan("")), Value("soon")}) {
        setting(Worker::kWaitTimeKey, wait);
        started(10);
        fake.clock.advance(11);
        overload(*session, 512);
        EXPECT_EQ(pauses.back(), std::chrono::microseconds(0)) << wait.description();
    }
    EXPECT_EQ(fake.diagnostics.count(), 5u);
}

}  // namespace
}  // namespace qv

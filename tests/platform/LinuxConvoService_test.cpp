#include "platform/linux/sinks/LinuxConvoService.h"

#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "fakes/FakeClock.h"
#include "fakes/FakeServices.h"
#include "fakes/SinkLines.h"
#include "fakes/TempDirectory.h"

namespace qv {
namespace {

using Backends = std::optional<std::vector<std::string>>;

class ALinuxConvoService : public ::testing::Test {
  protected:
    std::vector<nlohmann::ordered_json> lines() {
        service.flush();
        return test::readSinkLines(tmp.path() / "sinks" / "convo.jsonl");
    }
    // The answer to a configuration, and the thread it came on.
    std::pair<Backends, std::thread::id> configure(ConvoSession& session) {
        std::mutex m;
        std::condition_variable cv;
        std::optional<std::pair<Backends, std::thread::id>> answer;
        session.startConfiguration([&](const Backends& backends) {
            std::lock_guard lock(m);
            answer.emplace(backends, std::this_thread::get_id());
            cv.notify_one();
        });
        std::unique_lock lock(m);
        cv.wait(lock, [&] { return answer.has_value(); });
        return *answer;
    }

    test::TempDirectory tmp{"qvconvo"};
    test::FakeClock clock;
    test::FakePreferenceStore preferences;
    LinuxConvoService service{preferences, std::make_unique<JsonlSink>(tmp.path().string(), "convo",
                                                                       clock, SinkCallbacks{})};
};

TEST_F(ALinuxConvoService, AnswersFromItsSuiteReadAfreshAtEveryQuestion) {
    const std::string suite(LinuxConvoService::kSuite);
    const auto token = service.newHierarchyTokenFromParentToken(std::nullopt);
    ASSERT_TRUE(token);
    EXPECT_NE(*token, *service.newHierarchyTokenFromParentToken(std::nullopt));
    auto session = service.createSession({{"SessionID", 9}}, {}, std::nullopt);

    // No suite: the one default backend, on the service's thread, not the caller's.
    const auto [defaults, thread] = configure(*session);
    EXPECT_EQ(defaults, (Backends{{"jsonl"}}));
    EXPECT_NE(thread, std::this_thread::get_id());

    preferences.setValue(suite, "Backends", Array{"a", 3, "", "b"});
    EXPECT_EQ(configure(*session).first, (Backends{{"a", "b"}})) << "names only";
    for (const Value& none : {Value(Array{}), Value(Array{Value(""), Value(1)}), Value("jsonl")}) {
        preferences.setValue(suite, "Backends", none);
        EXPECT_EQ(configure(*session).first, std::nullopt) << none.description();
    }

    preferences.setValue(suite, "Enabled", "YES");
    EXPECT_TRUE(service.newHierarchyTokenFromParentToken(std::nullopt));
}

// The end-to-end test reads a whole session's lines; here, what a client cannot make it write.
TEST_F(ALinuxConvoService, NumbersItsSessionsAndWritesEachOnesSessionIDOrANull) {
    auto first = service.createSession({{"SessionID", 42}}, {}, std::nullopt);
    auto second = service.createSession({}, {}, std::nullopt);
    EXPECT_EQ(first->sendMessage(4, 18, {}), std::nullopt);
    EXPECT_EQ(second->sendMessage(0xFFFF, 0xFFFF, {}), std::nullopt);
    first->flush();
    EXPECT_EQ(first->description(), "<ConvoSession 1 sessionID=42>");

    const auto got = lines();
    ASSERT_EQ(got.size(), 5u);
    EXPECT_EQ(got[0]["session"], 1);
    EXPECT_EQ(got[1]["session"], 2);
    EXPECT_EQ(got[2]["sessionID"], 42);
    EXPECT_TRUE(got[3]["sessionID"].is_null());
    EXPECT_EQ(got[3]["category"], 65535);
}

}  // namespace
}  // namespace qv

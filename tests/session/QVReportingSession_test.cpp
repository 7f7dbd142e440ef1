#include "session/QVReportingSession.h"

#include <gtest/gtest.h>

#include <cmath>

#include <random>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv {
namespace {

using test::FakePlatform;

std::shared_ptr<QVReportingSessionMessage> msg(Dictionary payload,
                                               AudioEventCategory c = category::kPlayback,
                                               AudioEventType t = type::kStart) {
    return std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t);
}

class ASession : public ::testing::Test {
  protected:
    void SetUp() override { QVReportingWorkerRegistry::TEST_reset({}); }
    void TearDown() override { QVReportingWorkerRegistry::TEST_reset({}); }

    std::shared_ptr<QVReportingSession> make(ReporterID id = 42) {
        return QVReportingSession::initWithID(fake.platform, id, {1234});
    }
    double now() const { return fake.clock.now(); }

    FakePlatform fake;
};

TEST_F(ASession, StampsTimestampsReplacingStaleOrUnreadableOnesAndKeepingFutureOnes) {
    auto s = make();
    const double day = 86400;
    struct Case {
        Value sent;
        bool replaced;
    } cases[] = {
        {Value(now() - 366 * day), true}, {Value(now() - day), false},
        {Value(now() + 10 * day), false}, {Value("yesterday"), true},
        {Value(std::nan("")), true},      {Value(true), true},
        {Value(std::int64_t{0}), true},   {Value(now() - 365 * day), false},
    };
    for (const auto& c : cases) {
        auto m = msg({{"qvreporting_timestamp", c.sent}, {"n", c.sent.description()}});
        s->sendMessage(m);
        const Dictionary& p = m->message();
        SCOPED_TRACE(c.sent.description());
        if (c.replaced) {
            EXPECT_EQ(*p.find("qvreporting_timestamp"), Value(now()));
            ASSERT_TRUE(p.contains("invalid_timestamp"));
            EXPECT_EQ(p.find("invalid_timestamp")->description(), c.sent.description());
        } else {
            EXPECT_EQ(*p.find("qvreporting_timestamp"), c.sent);
            EXPECT_FALSE(p.contains("invalid_timestamp"));
        }
    }
    auto missing = msg({{"x", 1}});
    s->sendMessage(missing);
    EXPECT_EQ(*missing->message().find("invalid_timestamp"), Value("nil"));
    EXPECT_EQ(*missing->message().find("qvreporting_timestamp"), Value(now()));
}

TEST_F(ASession, CleansBlankKeysTagsAndNamesTheApplication) {
    auto s = make();
    auto m = msg({{"a_b", "underscore"}, {"a b", "blank"}, {"two  blanks", 2}, {"", 0}},
                 category::kPrefixDSP | category::kSetup, type::kStart);
    s->sendMessage(m);
    const Dictionary& p = m->message();
    EXPECT_EQ(*p.find("a_b"), Value("blank"));  // the blank form wins
    EXPECT_FALSE(p.contains("a b"));
    EXPECT_EQ(*p.find("two__blanks"), Value(2));
    EXPECT_TRUE(p.contains(""));
    EXPECT_EQ(*p.find("audiotag"), Value("DSP_SetupStart"));
    EXPECT_EQ(*p.find("HostApplicationDisplayID"), Value("Unknown"));

    Dictionary config{{"KXHostApplicationDisplayID", "com.example.player"}};
    s->updateConfigurationWithContentsOfConfiguration(&config);
    EXPECT_EQ(*s->configuration().find("HostApplicationDisplayID"), Value("com.example.player"));
    auto unknown = msg({{"HostApplicationDisplayID", "Unknown"}});
    auto own = msg({{"HostApplicationDisplayID", "com.example.other"}});
    s->sendMessage(unknown);
    s->sendMessage(own);
    EXPECT_EQ(*unknown->message().find("HostApplicationDisplayID"), Value("com.example.player"));
    EXPECT_EQ(*own->message().find("HostApplicationDisplayID"), Value("com.example.other"));
}

TEST_F(ASession, MarksRepeatsOfTheNewestSameKindMessageRedundantAndDoesNotStoreThem) {
    auto s = make();
    s->sendMessage(msg({{"v", 1}, {"processuptime_ms", 5}, {"qvreporting_timestamp", now()}}));
    auto repeat = msg({{"v", 1.0},
                       {"processuptime_ms", 9},
                       {"systemuptime_sec", 3},
                       {"qvreporting_timestamp", now() + 5}});
    s->sendMessage(repeat);
    EXPECT_TRUE(repeat->isRedundant());
    EXPECT_EQ(s->messages().size(), 1u);
    EXPECT_EQ(s->totalMessageCount(), 2);

    // Another kind with the same payload is not a repeat; nor is an extra key.
    auto otherKind = msg({{"v", 1}}, category::kPlayback, type::kStop);
    auto extraKey = msg({{"v", 1}, {"w", 2}});
    s->sendMessage(otherKind);
    s->sendMessage(extraKey);
    EXPECT_FALSE(otherKind->isRedundant());
    EXPECT_FALSE(extraKey->isRedundant());

    // Only the newest of the kind counts: {v:1} after {v:1, w:2} is new again.
    auto back = msg({{"v", 1}});
    s->sendMessage(back);
    EXPECT_FALSE(back->isRedundant());

    // Errors are never redundant.
    for (auto [c, t] : {std::pair{category::kPlayback, type::kError},
                        std::pair{category::kError, type::kStart}}) {
        s->sendMessage(msg({{"e", 1}}, c, t));
        auto again = msg({{"e", 1}}, c, t);
        s->sendMessage(again);
        EXPECT_FALSE(again->isRedundant());
    }
    EXPECT_EQ(*s->previousValues().find("w"), Value(2));
}

TEST_F(ASession, AppendsStateMessagesAtStartAndStopAndEmptiesItsStoreOnStop) {
    auto s = make(7);
    s->stop();  // never started: only the stop state message
    ASSERT_EQ(s->messages().size(), 1u);
    const Dictionary& early = s->messages()[0]->message();
    EXPECT_EQ(*early.find("method"), Value("stop"));
    EXPECT_EQ(*early.find("running_at_stop"), Value("NO"));
    EXPECT_EQ(*early.find("messages_at_stop"), Value(0));
    EXPECT_FALSE(s->started());

    s->sendMessage(msg({{"a", 1}}));
    s->start();
    ASSERT_EQ(s->messages().size(), 3u);
    const auto& startMessage = *s->messages()[2];
    EXPECT_EQ(startMessage.category(), category::kSetup);
    EXPECT_EQ(startMessage.type(), type::kStart);
    std::vector<std::string> keys;
    for (const auto& [k, v] : startMessage.message())
        keys.push_back(k);
    EXPECT_EQ(keys,
              (std::vector<std::string>{"method", "messages_at_start", "unique_messages_at_start",
                                        "reporterid", "running_at_start", "invalid_timestamp",
                                        "qvreporting_timestamp", "audiotag"}));
    EXPECT_EQ(*startMessage.message().find("messages_at_start"), Value(2));
    EXPECT_EQ(startMessage.message().find("unique_messages_at_start")->kind(), Value::Kind::UInt);
    EXPECT_EQ(*startMessage.message().find("reporterid"), Value(7));
    EXPECT_EQ(*startMessage.message().find("audiotag"), Value("SetupStart"));
    EXPECT_EQ(*startMessage.message().find("running_at_start"), Value("NO"));

    s->start();  // again: another state message, saying it was running
    EXPECT_EQ(*s->messages().back()->message().find("running_at_start"), Value("YES"));
    s->sendMessage(msg({{"b", 2}}));
    s->stop();
    EXPECT_TRUE(s->messages().empty());
    EXPECT_EQ(s->totalMessageCount(), 0);
    EXPECT_FALSE(s->started());
    EXPECT_TRUE(s->previousValues().contains("a"));

    // A restarted session begins empty; a message equal to one before the stop is new again.
    s->start();
    auto again = msg({{"b", 2}});
    s->sendMessage(again);
    EXPECT_FALSE(again->isRedundant());
    EXPECT_EQ(s->messages().size(), 2u);
}

TEST_F(ASession, DescribesItselfAndLogsItsLife) {
    test::ScopedMemoryLog log;
    {
        auto s = make(5);
        s->setServiceType(service::kTest);
        s->setClientProcessName("player");
        EXPECT_EQ(s->serviceName(), "test");
        EXPECT_EQ(s->description(),
                  "reporterID=5,serviceName=test,ownerPid=1234,clientProcessName=player,"
                  "HostApplicationDisplayID=(null),started=0,singleMessageSession=0");
        s->start();
        s->sendMessage(msg({{"k", "v"}}));
    }
    EXPECT_TRUE(log->contains("created reporting session for ID: 5"));
    EXPECT_TRUE(log->contains("setting service type test"));
    EXPECT_TRUE(log->contains("start called. reporterID=5"));
    EXPECT_TRUE(
        log->contains("QVReportingSessionWorker action=sendMessage reporterID=5 "
                      "app=Unknown redundant=NO message=category=Playback type=Start {"));
    EXPECT_TRUE(log->contains("deallocing this session 5"));
    // The prefix: file name right-aligned in 25 columns, line number left-aligned in 5.
    const auto lines = log->lines();
    ASSERT_FALSE(lines.empty());
    EXPECT_EQ(lines.front().text.substr(0, 26), "   QVReportingSession.cpp:");
    EXPECT_EQ(lines.front().text[31], ' ');
}

// The redundancy index must give exactly what a newest-to-oldest search of the store gives,
// through sorting at stop, derived messages sent while stopping, and restarts.
TEST_F(ASession, FindsTheSameRedundancyAsASearchOfTheStoreUnderRandomTraffic) {
    auto s = make();
    std::mt19937 rng(7);
    auto reference = [&](const QVReportingSessionMessage& m) {
        if (m.type() == type::kError || m.category() == category::kError)
            return false;
        const auto& stored = s->messages();
        for (auto it = stored.rbegin(); it != stored.rend(); ++it) {
            if ((*it)->category() != m.category() || (*it)->type() != m.type())
                continue;
            Dictionary a = m.message(), b = (*it)->message();
            for (auto k : {"processuptime_ms", "systemuptime_sec", "qvreporting_timestamp"}) {
                a.erase(k);
                b.erase(k);
            }
            return a == b;
        }
        return false;
    };
    auto randomMessage = [&] {
        Dictionary p{{"v", static_cast<int>(rng() % 3)},
                     {"qvreporting_timestamp", now() - static_cast<double>(rng() % 100)}};
        if (rng() % 4 == 0)
            p.set("extra", "x");
        return msg(std::move(p), static_cast<AudioEventCategory>(rng() % 4 + 9),
                   static_cast<AudioEventType>(rng() % 3 + 5));
    };
    for (int round = 0; round < 5; ++round) {
        s->start();
        for (int i = 0; i < 300; ++i) {
            auto m = randomMessage();
            // Stamp a copy first so the reference sees the payload the session will compare.
            auto probe = m->copy();
            QVReportingSession::addMissingDates(*probe, fake.clock);
            QVReportingSession::removeWhiteSpaceFromKeys(*probe);
            QVReportingSession::addAudioMessageTag(*probe);
            s->addAppName(*probe);
            const bool expected = reference(*probe);
            s->sendMessage(m);
            ASSERT_EQ(m->isRedundant(), expected) << "round " << round << " message " << i;
        }
        s->stop();
    }
}

}  // namespace
}  // namespace qv

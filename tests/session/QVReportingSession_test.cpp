#include "session/QVReportingSession.h"

#include <fmt/format.h>
#include <gtest/gtest.h>

#include <cmath>
#include <random>
#include <string>
#include <vector>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingStats.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using test::message;

class ASession : public ::testing::Test {
  protected:
    std::shared_ptr<QVReportingSession> make(ReporterID id = 42) {
        return QVReportingSession::initWithID(fake.platform, id, {1234});
    }
    double now() const { return fake.clock.now(); }

    test::ScopedWorkerClasses<> workerClasses;  // none
    test::FakePlatform fake;
};

TEST_F(ASession, ReplacesStaleOrUnreadableTimestampsAndKeepsRecentAndFutureOnes) {
    auto s = make();
    const double day = 86400;
    // Built one by one: gcc 12 warns falsely about an array of Value temporaries under -O2.
    std::vector<std::pair<Value, bool>> cases;
    cases.emplace_back(now() - 366 * day, true);
    cases.emplace_back(now() - 365 * day, false);
    cases.emplace_back(now() + 10 * day, false);
    cases.emplace_back("yesterday", true);
    cases.emplace_back(std::nan(""), true);
    cases.emplace_back(Value(), true);
    for (const auto& [sent, replaced] : cases) {
        auto m = message({{"n", sent.description()}});
        if (!sent.isNull()) {
            m->message().set("qvreporting_timestamp", sent);
        }
        s->sendMessage(m);
        const Dictionary& p = m->message();
        SCOPED_TRACE(sent.description());
        EXPECT_EQ(*p.find("qvreporting_timestamp"), replaced ? Value(now()) : sent);
        EXPECT_EQ(p.contains("invalid_timestamp"), replaced);
        if (replaced) {
            const Value expected = sent.isNull() ? Value("nil") : sent;  // NaN: compare text
            EXPECT_EQ(p.find("invalid_timestamp")->description(), expected.description());
        }
    }
}

TEST_F(ASession, CleansBlankKeysTagsAndNamesTheApplication) {
    auto s = make();
    auto m = message({{"a_b", "underscore"}, {"a b", "blank"}},
                     category::kPrefixDSP | category::kSetup, type::kStart);
    s->sendMessage(m);
    const Dictionary& p = m->message();
    EXPECT_EQ(*p.find("a_b"), Value("blank"));  // the blank form wins
    EXPECT_FALSE(p.contains("a b"));
    EXPECT_EQ(*p.find("audiotag"), Value("DSP_SetupStart"));
    EXPECT_EQ(*p.find("HostApplicationDisplayID"), Value("Unknown"));

    // A configured name replaces "Unknown" but not a name the message brings.
    Dictionary config{{"KXHostApplicationDisplayID", "com.example.player"}};
    s->updateConfigurationWithContentsOfConfiguration(&config);
    for (const std::string sent : {"Unknown", "com.example.other"}) {
        auto named = message({{"HostApplicationDisplayID", sent}});
        s->sendMessage(named);
        EXPECT_EQ(*named->message().find("HostApplicationDisplayID"),
                  Value(sent == "Unknown" ? "com.example.player" : sent));
    }
}

TEST_F(ASession, IgnoresUptimesAndTimeForRedundancyStoresNoRepeatsAndEmptiesTheStoreOnStop) {
    auto s = make(7);
    s->sendMessage(message({{"v", 1}, {"processuptime_ms", 5}, {"qvreporting_timestamp", now()}}));
    auto repeat = message({{"v", 1.0},
                           {"processuptime_ms", 9},
                           {"systemuptime_sec", 3},
                           {"qvreporting_timestamp", now() + 5}});
    s->sendMessage(repeat);
    EXPECT_TRUE(repeat->isRedundant());
    EXPECT_EQ(s->messages().size(), 1u);
    EXPECT_EQ(s->totalMessageCount(), 2);

    // Starting appends a state message; stopping empties the store.
    s->start();
    ASSERT_EQ(s->messages().size(), 2u);
    const Dictionary& started = s->messages()[1]->message();
    EXPECT_EQ(*started.find("messages_at_start"), Value(1));  // repeats are not stored
    EXPECT_EQ(*started.find("reporterid"), Value(7));
    EXPECT_EQ(*started.find("running_at_start"), Value("NO"));

    s->sendMessage(message({{"b", 2}}));
    s->stop();
    EXPECT_TRUE(s->messages().empty());
    // A restarted session begins empty: a message equal to one before the stop is new again.
    s->start();
    auto again = message({{"b", 2}});
    s->sendMessage(again);
    EXPECT_FALSE(again->isRedundant());
}

// The redundancy index must agree with a newest-to-oldest search of the store, through the
// sort at stop and restarts.
TEST_F(ASession, RemembersABoundedNumberOfDistinctKeysAndKeepsUpdatingKnownOnes) {
    test::ScopedMemoryLog log;
    auto& stats = QVReportingStats::shared();
    stats.TEST_reset();
    constexpr std::size_t kMax = QVReportingStats::kMaxPreviousValuesKeys;
    auto s = make();
    Dictionary many;
    for (std::size_t i = 0; i < kMax - 10; ++i) {
        many.set(fmt::format("k{}", i), 0);
    }
    s->sendMessage(message(many));  // stamping adds four keys: six places are left
    ASSERT_EQ(s->previousValues().size(), kMax - 6);
    Dictionary more{{"k0", 1}};
    for (int i = 0; i < 20; ++i) {
        more.set("new" + std::to_string(i), i);
    }
    s->sendMessage(message(more));
    EXPECT_EQ(s->previousValues().size(), kMax);
    EXPECT_EQ(*s->previousValues().find("k0"), Value(1));
    EXPECT_TRUE(s->previousValues().contains("new5"));
    EXPECT_FALSE(s->previousValues().contains("new6"));
    s->sendMessage(message({{"k1", 2}, {"later", 1}}));
    EXPECT_EQ(*s->previousValues().find("k1"), Value(2));
    EXPECT_EQ(stats.dump().find("previous_values_dropped")->longLongValue(), 15);
    EXPECT_EQ(log->count("new keys are no longer remembered"), 1u);
    stats.TEST_reset();
}

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
    for (int round = 0; round < 3; ++round) {
        s->start();
        for (int i = 0; i < 200; ++i) {
            Dictionary p{{"v", static_cast<int>(rng() % 3)},
                         {"qvreporting_timestamp", now() - static_cast<double>(rng() % 100)}};
            if (rng() % 4 == 0)
                p.set("extra", "x");
            auto m = message(std::move(p), static_cast<AudioEventCategory>(rng() % 4 + 9),
                             static_cast<AudioEventType>(rng() % 3 + 5));
            // The reference compares the payload as the session will have cleaned it.
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

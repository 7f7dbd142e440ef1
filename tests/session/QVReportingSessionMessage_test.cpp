#include "session/QVReportingSessionMessage.h"

#include <gtest/gtest.h>

#include <cmath>

#include "session/QVReportingWorkerClass.h"

namespace qv {
namespace {

TEST(AMessage, OwnsItsTopLevelKeysButSharesNestedContainers) {
    Dictionary payload{{"a", 1}, {"nested", Dictionary{{"x", "y"}}}};
    QVReportingSessionMessage m(payload, category::kPlayback, type::kStart);
    payload.set("a", 2);
    payload.set("b", 3);
    EXPECT_EQ(*m.message().find("a"), Value(1));
    EXPECT_FALSE(m.message().contains("b"));
    EXPECT_EQ(m.message().find("nested")->asDictionary(), payload.find("nested")->asDictionary());
}

TEST(AMessage, CopiesFlagsAndPayloadButNotDestinations) {
    static const QVReportingWorkerClass someWorker{"SomeWorker"};
    QVReportingSessionMessage m({{"k", "v"}}, category::kVolume, type::kSummary);
    m.setIsRedundant(true);
    m.setIsSessionStarted(true);
    m.setDestinationWorkers({&someWorker});
    auto copy = m.copy();
    EXPECT_TRUE(copy->isRedundant());
    EXPECT_TRUE(copy->isSessionStarted());
    EXPECT_TRUE(copy->destinationWorkers().empty());
    EXPECT_EQ(copy->category(), category::kVolume);
    EXPECT_EQ(copy->type(), type::kSummary);
    copy->message().set("k", "changed");
    EXPECT_EQ(*m.message().find("k"), Value("v"));
}

TEST(AMessage, DescribesItselfWithItsVocabularyNames) {
    QVReportingSessionMessage m({{"volume", 0.5}, {"device name", "Desk speaker"}},
                                category::kPrefixHAL | category::kRouteChange, 99);
    EXPECT_EQ(m.description(),
              "category=HAL_RouteChange type=Generic {\n    volume = 0.5;\n"
              "    \"device name\" = \"Desk speaker\";\n}");
}

TEST(Messages, SortByTimeStablyWithMissingAndNaNTimesAsZero) {
    std::vector<std::shared_ptr<QVReportingSessionMessage>> list;
    auto add = [&](Value t, int tag) {
        Dictionary p{{"tag", tag}};
        if (!t.isNull())
            p.set("qvreporting_timestamp", t);
        list.push_back(std::make_shared<QVReportingSessionMessage>(p, 1, 0));
    };
    add(5.0, 0);
    add(3.0, 1);
    add(5.0, 2);
    add(Value(), 3);
    add(std::nan(""), 4);
    add(std::int64_t{3}, 5);
    add(-1.0, 6);
    QVReportingSessionMessage::sortMessages(list);
    std::vector<int> tags;
    for (const auto& m : list)
        tags.push_back(static_cast<int>(*m->message().find("tag")->asInt64()));
    EXPECT_EQ(tags, (std::vector<int>{6, 3, 4, 1, 5, 0, 2}));
}

}  // namespace
}  // namespace qv

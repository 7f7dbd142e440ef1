#include "session/QVReportingSessionMessage.h"

#include <gtest/gtest.h>

#include <cmath>

#include "session/QVReportingWorkerClass.h"

namespace qv {
namespace {

TEST(AMessage, OwnsItsTopLevelKeysAndCopiesFlagsButNotDestinations) {
    static const QVReportingWorkerClass someWorker{"SomeWorker"};
    Dictionary payload{{"k", "v"}};
    QVReportingSessionMessage m(payload, category::kVolume, type::kSummary);
    payload.set("k", "changed by the sender");
    EXPECT_EQ(*m.message().find("k"), Value("v"));

    m.setDestinationWorkers({&someWorker});
    auto copy = m.copy();
    EXPECT_TRUE(copy->destinationWorkers().empty());
    copy->message().set("k", "changed in the copy");
    EXPECT_EQ(*m.message().find("k"), Value("v"));
}

TEST(Messages, SortByTimeStablyWithMissingAndNaNTimesAsZero) {
    std::vector<std::shared_ptr<QVReportingSessionMessage>> list;
    int tag = 0;
    for (const Value& t : {Value(5.0), Value(3.0), Value(5.0), Value(), Value(std::nan("")),
                           Value(std::int64_t{3}), Value(-1.0)}) {
        Dictionary p{{"tag", tag++}};
        if (!t.isNull())
            p.set("qvreporting_timestamp", t);
        list.push_back(std::make_shared<QVReportingSessionMessage>(p, 1, 0));
    }
    QVReportingSessionMessage::sortMessages(list);
    std::vector<int> tags;
    for (const auto& m : list)
        tags.push_back(static_cast<int>(*m->message().find("tag")->asInt64()));
    EXPECT_EQ(tags, (std::vector<int>{6, 3, 4, 1, 5, 0, 2}));
}

}  // namespace
}  // namespace qv

#include "workers/backends/QVReportingConvoSessionSummary.h"

#include <limits>

#include "values/FrozenPayloads.h"
#include "workers/WorkerTestSupport.h"

namespace qv {
namespace {

using test::keysOf;

TEST(AConvoSessionSummary, JoinsEachKeysValuesInMessageOrderWithKeysInOrderOfFirstAppearance) {
    QVReportingConvoSessionSummary summary(service::kTelephony);
    summary.add({{"a", 1}, {"b", "x"}});
    summary.add({{"a", 2}});
    // A payload of another shape, keys in another order, and the summary's own key.
    summary.add({{"c", true}, {"a", 3}, {"QV_Session_Summary_Event", "client"}, {"b", "y z"}});
    const Dictionary d = summary.joined();
    EXPECT_EQ(keysOf(d), (std::vector<std::string>{"QV_Session_Summary_Event", "a", "b", "c"}));
    // Every column is text; strings go as they are, blanks included.
    EXPECT_EQ(
        d,
        (Dictionary{
            {"QV_Session_Summary_Event", "2,client"}, {"a", "1,2,3"}, {"b", "x,y z"}, {"c", "1"}}));

    // A key left out entirely: no column, and the others keep theirs.
    QVReportingConvoSessionSummary untimed(service::kGeneric, "t");
    untimed.add({{"t", 1.5}, {"a", 1}});
    untimed.add({{"a", 2}, {"t", 2.5}});
    EXPECT_EQ(untimed.joined(), (Dictionary{{"QV_Session_Summary_Event", "0"}, {"a", "1,2"}}));

    // Only the service type when nothing is folded in; the unknown type prints in decimal.
    EXPECT_EQ(QVReportingConvoSessionSummary(service::kUnknown).joined(),
              (Dictionary{{"QV_Session_Summary_Event", "65535"}}));
}

TEST(AConvoSessionSummary, PrintsEveryKindOfValueAsItsDescriptionAndRepeatsOnlyEqualNumbers) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const std::vector<Value> values = {
        Value(0.1),
        Value(-0.0),
        Value(0.0),
        Value(nan),
        Value(nan),
        Value(std::numeric_limits<double>::infinity()),
        Value(1e300),
        Value(std::numeric_limits<std::int64_t>::min()),
        Value(std::numeric_limits<std::uint64_t>::max()),
        Value(std::int64_t{1}),
        Value(1.0),
        Value(true),
        Value(false),
        Value(""),
        Value("a,b \"quoted\"\n"),
        Value(Bytes{0xde, 0xad}),
        Value(Date{86400.5}),
        Value(),
        Value(Array{1, "two", Array{}}),
        Value(Dictionary{{"k y", 1}, {"n", Dictionary{}}}),
    };
    QVReportingConvoSessionSummary summary(service::kGeneric);
    std::string expected;
    for (const Value& v : values) {
        summary.add({{"v", v}});
        if (!expected.empty()) {
            expected += ',';
        }
        expected += QVReportingValueText(&v);
    }
    EXPECT_EQ(summary.joined(), (Dictionary{{"QV_Session_Summary_Event", "0"}, {"v", expected}}));
}

TEST(FrozenPayloads, ComeBackEqualInOrderSharingNestedContainersAndBlindToLaterChanges) {
    const Value nested(Array{1, 2});
    Dictionary source{{"long key past the short-string size", "a string past the short size"},
                      {"n", 1.5},
                      {"", ""},
                      {"list", nested},
                      {"u", std::numeric_limits<std::uint64_t>::max()}};
    FrozenPayloads frozen;
    frozen.reserveFor(3, source);  // room only: nothing to see
    frozen.append(Dictionary{});
    frozen.append(source);
    frozen.append(Dictionary{{"last", 1}});
    source.set("n", 99);
    source.set("added", true);
    ASSERT_EQ(frozen.size(), 3u);
    EXPECT_TRUE(frozen.thaw(0).empty());
    const Dictionary thawed = frozen.thaw(1, 2);
    EXPECT_EQ(keysOf(thawed), (std::vector<std::string>{"long key past the short-string size", "n",
                                                        "", "list", "u"}));
    EXPECT_EQ(*thawed.find("n"), Value(1.5));
    EXPECT_EQ(*thawed.find("long key past the short-string size"),
              Value("a string past the short size"));
    EXPECT_EQ(thawed.find("list")->asArray(), nested.asArray()) << "shared, not copied";
    EXPECT_EQ(thawed.find("u")->asUInt64(), std::numeric_limits<std::uint64_t>::max());
    EXPECT_EQ(frozen.thaw(2), (Dictionary{{"last", 1}}));
}

}  // namespace
}  // namespace qv

#include "values/ValueJson.h"

#include <fmt/format.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

namespace qv {
namespace {

using nlohmann::ordered_json;

// Through text and back, as a line of a file makes the trip.
Dictionary roundTrip(const Dictionary& d) {
    return QVReportingDictionaryFromJson(
        ordered_json::parse(QVReportingDictionaryToJson(d).dump()));
}

TEST(ValueJson, WritesEveryKindAsItsJsonFormInInsertionOrder) {
    const Dictionary d{
        {"z", 1},
        {"a", std::numeric_limits<std::uint64_t>::max()},
        {"neg", std::numeric_limits<std::int64_t>::min()},
        {"d", 0.5},
        {"s", "x\"y"},
        {"b", false},
        {"n", nullptr},
        {"bytes", Bytes{'f', 'o', 'o'}},
        {"date", Date{1706707501.5}},
        {"list", Array{1, Array{}, Dictionary{}}},
    };
    EXPECT_EQ(QVReportingDictionaryToJson(d).dump(),
              R"({"z":1,"a":18446744073709551615,"neg":-9223372036854775808,"d":0.5,)"
              R"("s":"x\"y","b":false,"n":null,"bytes":"Zm9v","date":1706707501.5,)"
              R"("list":[1,[],{}]})");
}

TEST(ValueJson, NumbersKeepTheirValueAndIntegersTheirKindThroughText) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    const double inf = std::numeric_limits<double>::infinity();
    const Dictionary d{
        {"small", 42},
        {"negative", -7},
        {"imax", std::numeric_limits<std::int64_t>::max()},
        {"imin", std::numeric_limits<std::int64_t>::min()},
        {"umax", std::numeric_limits<std::uint64_t>::max()},
        {"u63", std::uint64_t{1} << 63},
        {"unsignedSmall", 5u},
        {"tenth", 0.1},
        {"third", 1.0 / 3.0},
        {"tiny", 5e-324},
        {"huge", 1.7976931348623157e308},
        {"whole", 2.0},
        {"nan", nan},
        {"inf", -inf},
        {"nanDate", Date{nan}},
    };
    const Dictionary back = roundTrip(d);
    ASSERT_EQ(back.size(), d.size());
    for (const char* key : {"small", "negative", "imax", "imin"}) {
        EXPECT_EQ(back.find(key)->kind(), Value::Kind::Int) << key;
        EXPECT_EQ(*back.find(key), *d.find(key)) << key;
    }
    EXPECT_EQ(back.find("umax")->asUInt64(), std::numeric_limits<std::uint64_t>::max());
    EXPECT_EQ(back.find("u63")->asUInt64(), std::uint64_t{1} << 63);
    // An unsigned number that fits a signed integer reads back as Int: same value.
    EXPECT_EQ(back.find("unsignedSmall")->kind(), Value::Kind::Int);
    EXPECT_EQ(*back.find("unsignedSmall"), Value(5));
    for (const char* key : {"tenth", "third", "tiny", "huge", "whole"}) {
        EXPECT_EQ(back.find(key)->kind(), Value::Kind::Double) << key;
        EXPECT_EQ(back.find(key)->asDouble(), d.find(key)->asDouble()) << key;
    }
    for (const char* key : {"nan", "inf", "nanDate"}) {
        EXPECT_TRUE(back.find(key)->isNull()) << key;
    }
}

TEST(ValueJson, BytesAndDatesComeBackAsTheirJsonForms) {
    const Dictionary back = roundTrip(Dictionary{
        {"bytes", Bytes{0xfb, 0xff}}, {"date", Date{1706707501.25}}, {"empty", Bytes{}}});
    EXPECT_EQ(*back.find("bytes"), Value("+/8="));
    EXPECT_EQ(*back.find("date"), Value(1706707501.25));
    EXPECT_EQ(*back.find("empty"), Value(""));
}

TEST(ValueJson, ReadsNestedObjectsInSourceOrderAndRefusesNonObjectsAsDictionaries) {
    const auto json = ordered_json::parse(
        R"({"b":{"y":1,"x":[true,null,"s",1.5,-2]},"a":[],"c":"text","d":1.0})");
    const Dictionary d = QVReportingDictionaryFromJson(json);
    std::vector<std::string> keys;
    for (const auto& entry : d) {
        keys.push_back(entry.first);
    }
    EXPECT_EQ(keys, (std::vector<std::string>{"b", "a", "c", "d"}));
    const Dictionary* b = d.find("b")->asDictionary();
    ASSERT_NE(b, nullptr);
    EXPECT_EQ(b->begin()->first, "y");
    EXPECT_EQ(*b->find("x"), Value(Array{true, nullptr, "s", 1.5, -2}));
    EXPECT_TRUE(d.find("a")->isArray());
    EXPECT_EQ(d.find("d")->kind(), Value::Kind::Double);
    EXPECT_EQ(*d.find("d"), Value(1));

    // The unordered flavour is read too (its keys come sorted).
    const Dictionary sorted =
        QVReportingDictionaryFromJson(nlohmann::json::parse(R"({"b":1,"a":[2]})"));
    EXPECT_EQ(sorted.begin()->first, "a");
    EXPECT_EQ(*sorted.find("a"), Value(Array{2}));

    for (const char* notAnObject : {"[1,2]", "3", "\"s\"", "null"}) {
        EXPECT_TRUE(QVReportingDictionaryFromJson(ordered_json::parse(notAnObject)).empty())
            << notAnObject;
    }
    EXPECT_EQ(QVReportingValueFromJson(ordered_json::parse("[1,\"x\"]")), Value(Array{1, "x"}));
    EXPECT_EQ(QVReportingValueFromJson(ordered_json::binary({1, 2, 255})), Value(Bytes{1, 2, 255}));
}

TEST(ValueJson, LargeDictionariesKeepTheirOrderBothWays) {
    Dictionary big;
    for (int i = 4999; i >= 0; --i) {
        big.set(fmt::format("k{}", i), i);
    }
    const Dictionary back = roundTrip(big);
    ASSERT_EQ(back.size(), big.size());
    auto it = back.begin();
    for (const auto& [key, value] : big) {
        ASSERT_EQ(it->first, key);
        EXPECT_EQ(it->second, value);
        ++it;
    }
}

}  // namespace
}  // namespace qv

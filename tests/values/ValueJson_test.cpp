#include "values/ValueJson.h"

#include <fmt/format.h>
#include <fmt/ranges.h>
#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cmath>
#include <cstdint>
#include <limits>
#include <random>
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

// A value of every kind, random in shape and content, for the writers to agree on.
Value randomValue(std::mt19937& random, int depth) {
    const int kind = static_cast<int>(random() % (depth > 3 ? 8 : 10));
    const auto text = [&] {
        static const std::vector<std::string> pieces = {
            "a",    " ",    "\"", "\\", "\n", "\t", std::string(1, '\0'),
            "\x1f", "\x7f", "é",  "€",  "😀",  "/",  "key"};
        std::string s;
        for (auto n = random() % 5; n > 0; --n) {
            s += pieces[random() % pieces.size()];
        }
        return s;
    };
    switch (kind) {
        case 0:
            return Value();
        case 1:
            return Value(random() % 2 == 0);
        case 2:
            return Value(static_cast<std::int64_t>(random()) - (std::int64_t{1} << 31));
        case 3:
            return Value(std::numeric_limits<std::uint64_t>::max() - random());
        case 4: {
            // Doubles across the whole range, integral ones included.
            const double mantissa = static_cast<double>(random()) / 7.0;
            const int exponent = static_cast<int>(random() % 80) - 40;
            return Value(random() % 3 == 0 ? std::floor(mantissa) : std::ldexp(mantissa, exponent));
        }
        case 5:
            return Value(text());
        case 6:
            return Value(Bytes{static_cast<std::uint8_t>(random()), 0xff, 0x00});
        case 7:
            return Value(Date{static_cast<double>(random()) / 3.0});
        case 8: {
            Array array;
            for (auto n = random() % 4; n > 0; --n) {
                array.push_back(randomValue(random, depth + 1));
            }
            return Value(std::move(array));
        }
        default: {
            Dictionary dictionary;
            for (auto n = random() % 4; n > 0; --n) {
                dictionary.set(text() + std::to_string(n), randomValue(random, depth + 1));
            }
            return Value(std::move(dictionary));
        }
    }
}

TEST(ValueJson, WritesTextByteForByteAsNlohmannDoes) {
    const std::vector<Value> edges = {Value(0.1),
                                      Value(1.0),
                                      Value(-0.0),
                                      Value(1e20),
                                      Value(1e-5),
                                      Value(5e-324),
                                      Value(std::numeric_limits<double>::max()),
                                      Value(123456789012345678.0),
                                      Value(std::nan("")),
                                      Value(-std::numeric_limits<double>::infinity()),
                                      Value(std::numeric_limits<std::int64_t>::min()),
                                      Value(Dictionary{}),
                                      Value(Array{}),
                                      Value(Dictionary{{"", Array{Dictionary{}, Array{}}}}),
                                      Value(std::string("\x01\x1b"))};
    std::mt19937 random(20261123);
    std::vector<Value> values = edges;
    for (int i = 0; i < 400; ++i) {
        values.push_back(randomValue(random, 0));
    }
    for (const Value& value : values) {
        for (const int indent : {-1, 2, 4}) {
            std::string ours = "prefix";
            ASSERT_TRUE(QVReportingAppendJsonText(ours, value, indent));
            EXPECT_EQ(ours, "prefix" + QVReportingValueToJson(value).dump(indent))
                << value.description();
        }
    }
}

TEST(ValueJson, RefusesTheTextsNlohmannRefusesAndLeavesItsOutputAlone) {
    const std::vector<std::string> invalid = {"\x80",
                                              "\xc0\xaf",
                                              "\xc3",
                                              "\xe2\x82",
                                              "\xed\xa0\x80" /* a surrogate */,
                                              "\xf4\x90\x80\x80" /* beyond U+10FFFF */,
                                              "\xf8\x88\x80\x80\x80",
                                              "ok\xff"};
    std::mt19937 random(7);
    std::vector<std::string> texts = invalid;
    for (int i = 0; i < 2000; ++i) {
        std::string bytes;
        for (auto n = random() % 4; n > 0; --n) {
            bytes += static_cast<char>(0x80 + random() % 0x80);
        }
        texts.push_back(bytes);
    }
    for (const std::string& text : texts) {
        bool nlohmannAccepts = true;
        try {
            (void)ordered_json(text).dump();
        } catch (const nlohmann::json::exception&) {
            nlohmannAccepts = false;
        }
        std::string out = "kept";
        EXPECT_EQ(QVReportingAppendJsonText(out, Value(Dictionary{{"k", Array{text}}})),
                  nlohmannAccepts)
            << fmt::format("{:02x}", fmt::join(text, " "));
        if (!nlohmannAccepts) {
            EXPECT_EQ(out, "kept");
        }
    }
}

}  // namespace
}  // namespace qv

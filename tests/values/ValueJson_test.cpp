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
        {"nan", std::nan("")},
    };
    EXPECT_EQ(QVReportingDictionaryToJson(d).dump(),
              R"({"z":1,"a":18446744073709551615,"neg":-9223372036854775808,"d":0.5,)"
              R"("s":"x\"y","b":false,"n":null,"bytes":"Zm9v","date":1706707501.5,)"
              R"("list":[1,[],{}],"nan":null})");
}

// A value of every kind, random in shape and content, for the writers to agree on.
Value randomValue(std::mt19937& random, int depth) {
    const auto text = [&] {
        static const std::string pieces[] = {"a",    "\"",   "\\", "\n", std::string(1, '\0'),
                                             "\x1f", "\x7f", "é",  "😀",  "/"};
        std::string s;
        for (auto n = random() % 5; n > 0; --n)
            s += pieces[random() % std::size(pieces)];
        return s;
    };
    switch (random() % (depth > 3 ? 8 : 10)) {
        case 0:
            return Value();
        case 1:
            return Value(random() % 2 == 0);
        case 2:
            return Value(static_cast<std::int64_t>(random()) - (std::int64_t{1} << 31));
        case 3:
            return Value(std::numeric_limits<std::uint64_t>::max() - random());
        case 4: {  // doubles across the whole range, integral ones included
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
            for (auto n = random() % 4; n > 0; --n)
                array.push_back(randomValue(random, depth + 1));
            return Value(std::move(array));
        }
        default: {
            Dictionary dictionary;
            for (auto n = random() % 4; n > 0; --n)
                dictionary.set(text() + std::to_string(n), randomValue(random, depth + 1));
            return Value(std::move(dictionary));
        }
    }
}

TEST(ValueJson, WritesTextByteForByteAsNlohmannDoes) {
    std::vector<Value> values = {Value(0.1), Value(-0.0), Value(1e20), Value(5e-324),
                                 Value(-std::numeric_limits<double>::infinity())};
    std::mt19937 random(20261123);
    for (int i = 0; i < 300; ++i)
        values.push_back(randomValue(random, 0));
    int indent = 4;
    for (const Value& value : values) {
        indent = indent < 0 ? 4 : -1;  // the compact and the indented form in turn
        std::string ours = "prefix";   // appended to, never replaced
        ASSERT_TRUE(QVReportingAppendJsonText(ours, value, indent));
        EXPECT_EQ(ours, "prefix" + QVReportingValueToJson(value).dump(indent))
            << value.description();
    }
}

TEST(ValueJson, RefusesTheTextsNlohmannRefusesAndLeavesItsOutputAlone) {
    std::vector<std::string> texts = {"\xc0\xaf", "\xed\xa0\x80" /* a surrogate */,
                                      "\xf4\x90\x80\x80" /* beyond U+10FFFF */, "ok\xff"};
    std::mt19937 random(7);
    for (int i = 0; i < 1000; ++i) {
        std::string bytes;
        for (auto n = random() % 4; n > 0; --n)
            bytes += static_cast<char>(0x80 + random() % 0x80);
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

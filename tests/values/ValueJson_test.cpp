#include "values/ValueJson.h"

#include <fmt/format.h>
#include <fmt/ranges.h>
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

// The writers agree to the byte on what is hard to get right: escapes at the ends of the control
// range, text beyond ASCII, doubles at the ends of their range, nested containers, both forms.
TEST(ValueJson, WritesTextByteForByteAsNlohmannDoes) {
    const std::string texts[] = {std::string("a\0b", 3), "\x1f\x20\x7f", "\"\\/\n\r\t\b\f",
                                 "caf\xc3\xa9 \xf0\x9f\x98\x80"};
    std::vector<Value> values;
    for (const double d :
         {0.1, -0.0, 1e20, 5e-324, -1e-7, 3.0, -std::numeric_limits<double>::infinity()}) {
        values.emplace_back(d);
    }
    for (const std::string& text : texts) {
        values.emplace_back(text);
        values.emplace_back(Dictionary{{text, Array{text, Dictionary{}, Array{}}}});
    }
    values.emplace_back(Array{Value(), true, std::numeric_limits<std::uint64_t>::max(),
                              std::numeric_limits<std::int64_t>::min(), Bytes{0xff, 0x00},
                              Date{0.5}, Dictionary{{"k", Array{1, Array{2}}}}});
    for (const Value& value : values) {
        for (const int indent : {-1, 4}) {
            std::string ours = "prefix";  // appended to, never replaced
            ASSERT_TRUE(QVReportingAppendJsonText(ours, value, indent));
            EXPECT_EQ(ours, "prefix" + QVReportingValueToJson(value).dump(indent))
                << value.description() << " " << indent;
        }
    }
}

TEST(ValueJson, RefusesTheTextsNlohmannRefusesAndLeavesItsOutputAlone) {
    const std::string texts[] = {"\xc0\xaf",
                                 "\xed\xa0\x80" /* a surrogate */,
                                 "\xf4\x90\x80\x80" /* beyond U+10FFFF */,
                                 "ok\xff",
                                 "\xe2\x82",
                                 "\xed\x9f\xbf",
                                 "\xf4\x8f\xbf\xbf",
                                 "\xc2\x80"};
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

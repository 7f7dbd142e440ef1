#include "values/ValueJson.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <cmath>
#include <cstdint>
#include <limits>

namespace qv {
namespace {

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

}  // namespace
}  // namespace qv

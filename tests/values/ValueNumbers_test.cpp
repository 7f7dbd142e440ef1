#include "values/ValueNumbers.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include "values/Value.h"

namespace qv {
namespace {

constexpr std::int64_t kMax64 = std::numeric_limits<std::int64_t>::max();
constexpr std::int64_t kMin64 = std::numeric_limits<std::int64_t>::min();
constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();
constexpr double kInf = std::numeric_limits<double>::infinity();

TEST(ValueNumbers, IntegersComeFromNumbersAndLeadingDigitsAndClampInsteadOfWrapping) {
    struct Case {
        Value value;
        std::int64_t expected;
    };
    const std::vector<Case> cases = {
        {Value(true), 1},
        {Value(-1.9), -1},
        {Value(kNaN), 0},
        {Value(-kInf), kMin64},
        {Value(std::numeric_limits<std::uint64_t>::max()), kMax64},
        {Value("  \t-3 frames"), -3},
        {Value("12.9"), 12},
        {Value("abc"), 0},
        {Value("-"), 0},
        {Value("99999999999999999999"), kMax64},
        {Value("-9223372036854775808"), kMin64},
        {Value(Array{Value(5)}), 0},
        {Value(Date{1000.0}), 0},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(QVReportingIntegerValue(&c.value), c.expected) << c.value.description();
    }
    EXPECT_EQ(QVReportingIntegerValue(nullptr), 0);

    const Value big(std::int64_t{1} << 40);
    const Value small(-(std::int64_t{1} << 40));
    EXPECT_EQ(QVReportingIntValue(&big), std::numeric_limits<std::int32_t>::max());
    EXPECT_EQ(QVReportingIntValue(&small), std::numeric_limits<std::int32_t>::min());
    const Value text("-42x");
    EXPECT_EQ(QVReportingIntValue(&text), -42);
}

TEST(ValueNumbers, DoublesReadTextByItsLeadingDecimalNumberOnly) {
    struct Case {
        Value value;
        double expected;
    };
    const std::vector<Case> cases = {
        {Value(7), 7.0},        {Value("2.5e3x"), 2500.0},
        {Value(" -.5"), -0.5},  {Value("3e+"), 3.0},
        {Value("1e999"), kInf}, {Value("1e-999"), 0.0},
        {Value("e5"), 0.0},     {Value("nan"), 0.0},
        {Value("0x10"), 0.0},   {Value(Dictionary{}), 0.0},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(QVReportingDoubleValue(&c.value), c.expected) << c.value.description();
    }
    const Value nan(kNaN);
    EXPECT_TRUE(std::isnan(QVReportingDoubleValue(&nan))) << "a number is given back as it is";
    EXPECT_EQ(QVReportingDoubleValue(nullptr), 0.0);
}

}  // namespace
}  // namespace qv

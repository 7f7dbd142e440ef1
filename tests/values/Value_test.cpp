#include "values/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

namespace qv {
namespace {

std::vector<std::string> keysOf(const Dictionary& d) {
    std::vector<std::string> keys;
    for (const auto& entry : d)
        keys.push_back(entry.first);
    return keys;
}

TEST(Value, ComparesNumbersExactlyByValueAcrossKindsButNeverWithOtherKinds) {
    constexpr auto kUMax = std::numeric_limits<std::uint64_t>::max();
    constexpr auto kIMin = std::numeric_limits<std::int64_t>::min();
    const double nan = std::numeric_limits<double>::quiet_NaN();
    EXPECT_EQ(Value(1u), Value(1.0));
    EXPECT_EQ(Value(-0.0), Value(0));
    EXPECT_EQ(Value(true), Value(1));  // a bool is the number 0 or 1
    EXPECT_NE(Value(true), Value(2));
    // The double nearest to 2^64 - 1 is 2^64; an exact comparison tells them apart.
    EXPECT_NE(Value(kUMax), Value(18446744073709551616.0));
    EXPECT_EQ(Value(std::uint64_t{1} << 63), Value(9223372036854775808.0));
    EXPECT_NE(Value(std::numeric_limits<std::int64_t>::max()), Value(9223372036854775808.0));
    EXPECT_EQ(Value(kIMin), Value(-9223372036854775808.0));
    EXPECT_NE(Value(std::int64_t{(1LL << 53) + 1}), Value(9007199254740992.0));
    EXPECT_NE(Value(nan), Value(nan));
    EXPECT_NE(Value(std::uint64_t{0}), Value(nan));

    EXPECT_NE(Value("1"), Value(1));
    EXPECT_NE(Value(Date{5}), Value(5.0));
    EXPECT_EQ(Value(Array{1, "x"}), Value(Array{1.0, "x"}));
    EXPECT_NE(Value(Array{1, "x"}), Value(Array{1, "x", nullptr}));
    EXPECT_EQ(Value(Dictionary{{"x", 1}, {"y", "s"}}), Value(Dictionary{{"y", "s"}, {"x", 1.0}}));
    EXPECT_NE(Value(Dictionary{{"x", 1}}), Value(Dictionary{{"x", "1"}}));
}

TEST(Value, ConvertsOutOfRangeAndTextValuesSafely) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    EXPECT_EQ(Value(nan).asInt64(), 0);
    EXPECT_EQ(Value(1e300).asInt64(), std::numeric_limits<std::int64_t>::max());
    EXPECT_EQ(Value(-1e300).asInt64(), std::numeric_limits<std::int64_t>::min());
    EXPECT_TRUE(Value("  +007").boolValue());
    EXPECT_FALSE(Value("-0").boolValue());
    EXPECT_FALSE(Value(Array{1}).boolValue());
}

TEST(Value, ReadsTextByTheNumberItStartsWithAndEverythingElseAsZero) {
    const double inf = std::numeric_limits<double>::infinity();
    struct Case {
        Value value;
        double asDouble;
        std::int64_t asLongLong;
        std::int32_t asInt;
    };
    const Case cases[] = {
        {"0.5", 0.5, 0, 0},
        {" \t-2.75e1 dB", -27.5, -2, -2},
        {"+42abc", 42, 42, 42},
        {"3.9", 3.9, 3, 3},
        {".5", 0.5, 0, 0},
        {"1e", 1, 1, 1},  // an exponent without digits is not part of the number
        {"abc", 0, 0, 0},
        {"", 0, 0, 0},
        {"-", 0, 0, 0},
        {"0x10", 0, 0, 0},  // no hexadecimal
        {"nan", 0, 0, 0},
        {"1e999", inf, 1, 1},
        {"-1e999", -inf, -1, -1},
        {"1e-999", 0, 1, 1},
        {"99999999999999999999", 1e20, std::numeric_limits<std::int64_t>::max(),
         std::numeric_limits<std::int32_t>::max()},
        {"-3000000000", -3e9, -3000000000LL, std::numeric_limits<std::int32_t>::min()},
        {true, 1, 1, 1},
        {-7.9, -7.9, -7, -7},
        {std::int64_t{0x100000005}, 4294967301.0, 0x100000005, 5},  // C conversion: low bits
        {Array{1}, 0, 0, 0},
        {Value(), 0, 0, 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.value.description());
        EXPECT_EQ(c.value.doubleValue(), c.asDouble);
        EXPECT_EQ(c.value.longLongValue(), c.asLongLong);
        EXPECT_EQ(c.value.intValue(), c.asInt);
    }
    EXPECT_TRUE(std::isnan(Value(std::numeric_limits<double>::quiet_NaN()).doubleValue()));
    EXPECT_EQ(Value(std::numeric_limits<double>::quiet_NaN()).intValue(), 0);
}

TEST(DictionaryKey, SharesShortTextsOwnsLongOnesAndComparesByTextEitherWay) {
    const DictionaryKey a("session output"), b(std::string("session output"));
    EXPECT_TRUE(a.isInterned());
    EXPECT_EQ(a.data(), b.data()) << "one interned text";
    EXPECT_TRUE(a.hasBlank());
    EXPECT_FALSE(DictionaryKey("volume").hasBlank());
    EXPECT_EQ(a.ownedHeapBytes(), 0u);

    const std::string longText(DictionaryKey::kMaxInternedLength + 1, 'k');
    const std::size_t interned = DictionaryKey::TEST_internedCount();
    DictionaryKey owned(longText);
    EXPECT_FALSE(owned.isInterned());
    EXPECT_EQ(DictionaryKey::TEST_internedCount(), interned) << "long texts never fill the table";
    EXPECT_GT(owned.ownedHeapBytes(), longText.size());
    DictionaryKey copy = owned;
    owned = DictionaryKey("other");  // the copy keeps the text alive
    EXPECT_EQ(copy, DictionaryKey(longText));
    EXPECT_EQ(copy.str(), longText);
    EXPECT_EQ(std::hash<DictionaryKey>{}(copy), std::hash<std::string_view>{}(longText));
    EXPECT_TRUE(DictionaryKey() == "");
    EXPECT_LT(DictionaryKey("a"), DictionaryKey("b"));

    Dictionary d{{longText, 1}, {"session output", 2}};
    EXPECT_EQ(*d.find(longText), Value(1));
    EXPECT_EQ(*d.find(copy), Value(1));
    EXPECT_EQ(*d.find(b), Value(2));
}

TEST(Dictionary, KeepsInsertionOrderWhenAKeyIsOverwrittenAndAppendsAfterErase) {
    Dictionary d{{"c", 1}, {"a", 2}, {"b", 3}, {"a", "two"}};  // first place, last value
    EXPECT_EQ(keysOf(d), (std::vector<std::string>{"c", "a", "b"}));
    EXPECT_EQ(*d.find("a"), Value("two"));
    EXPECT_TRUE(d.erase("c"));
    EXPECT_FALSE(d.erase("c"));
    d.set("c", 4);
    d.merge(Dictionary{{"n", 3}, {"a", 4}});
    EXPECT_EQ(keysOf(d), (std::vector<std::string>{"a", "b", "c", "n"}));
    EXPECT_EQ(*d.find("a"), Value(4));
}

TEST(Dictionary, LargeDictionariesFindEraseAndOverwriteCorrectly) {
    constexpr int kCount = 5000;
    Dictionary d;
    for (int i = 0; i < kCount; ++i)
        d.set("key" + std::to_string(i), i);
    for (int i = 0; i < kCount; i += 3)
        ASSERT_TRUE(d.erase("key" + std::to_string(i)));
    // Positions moved under the index: survivors keep their own values, erased keys stay gone.
    for (int i = 0; i < kCount; ++i) {
        const Value* v = d.find("key" + std::to_string(i));
        if (i % 3 == 0) {
            EXPECT_EQ(v, nullptr) << i;
        } else {
            ASSERT_NE(v, nullptr) << i;
            EXPECT_EQ(*v, Value(i));
        }
    }
    d.set("key1", "overwritten");
    EXPECT_EQ(d.begin()->second, Value("overwritten"));
    d.set("key0", "back");
    EXPECT_EQ(std::prev(d.end())->first, "key0");

    // Shrinking below the indexing threshold and growing again.
    Dictionary small;
    for (int i = 0; i < 40; ++i)
        small.set(std::to_string(i), i);
    for (int i = 0; i < 35; ++i)
        small.erase(std::to_string(i));
    for (int i = 100; i < 130; ++i)
        small.set(std::to_string(i), i);
    EXPECT_EQ(*small.find("39"), Value(39));
    EXPECT_EQ(*small.find("129"), Value(129));
}

}  // namespace
}  // namespace qv

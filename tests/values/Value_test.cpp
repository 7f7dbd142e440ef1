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
    for (const auto& entry : d) {
        keys.push_back(entry.first);
    }
    return keys;
}

TEST(Value, NumbersCompareByValueAcrossIntegerAndFloatingKinds) {
    EXPECT_EQ(Value(1), Value(1.0));
    EXPECT_EQ(Value(1u), Value(1));
    EXPECT_EQ(Value(-0.0), Value(0));
    EXPECT_NE(Value(0.5), Value(0));
    // A bool is the number 0 or 1.
    EXPECT_EQ(Value(true), Value(1));
    EXPECT_EQ(Value(false), Value(0.0));
    EXPECT_NE(Value(true), Value(2));

    constexpr auto kUMax = std::numeric_limits<std::uint64_t>::max();
    constexpr auto kIMin = std::numeric_limits<std::int64_t>::min();
    constexpr auto kIMax = std::numeric_limits<std::int64_t>::max();
    // Same bits, different numbers.
    EXPECT_NE(Value(std::int64_t{-1}), Value(kUMax));
    EXPECT_EQ(Value(std::uint64_t{42}), Value(std::int64_t{42}));
    // The double nearest to 2^64 - 1 is 2^64; an exact comparison tells them apart.
    EXPECT_NE(Value(kUMax), Value(18446744073709551616.0));
    EXPECT_EQ(Value(std::uint64_t{1} << 63), Value(9223372036854775808.0));
    EXPECT_NE(Value(kIMax), Value(9223372036854775808.0));
    EXPECT_EQ(Value(kIMin), Value(-9223372036854775808.0));
    // Beyond 2^53 doubles skip integers; integers still compare exactly.
    EXPECT_NE(Value(std::int64_t{(1LL << 53) + 1}), Value(std::int64_t{1LL << 53}));
    EXPECT_NE(Value(std::int64_t{(1LL << 53) + 1}), Value(9007199254740992.0));
    // Far outside the integer range, no integer equals the double.
    EXPECT_NE(Value(kUMax), Value(1e300));
    EXPECT_NE(Value(kIMin), Value(-1e300));
}

TEST(Value, AStringNeverEqualsANumberAndKindsOtherwiseMustMatch) {
    EXPECT_NE(Value("1"), Value(1));
    EXPECT_NE(Value(""), Value(0));
    EXPECT_NE(Value(1), Value("1"));
    EXPECT_NE(Value(nullptr), Value(0));
    EXPECT_NE(Value(Date{5}), Value(5.0));
    EXPECT_EQ(Value(nullptr), Value());
    EXPECT_EQ(Value("a"), Value(std::string("a")));
    EXPECT_EQ(Value(Bytes{1, 2}), Value(Bytes{1, 2}));
    EXPECT_NE(Value(Bytes{1, 2}), Value(Bytes{1, 3}));
    EXPECT_EQ(Value(Array{1, "x"}), Value(Array{1.0, "x"}));
    EXPECT_NE(Value(Array{1, "x"}), Value(Array{1, "x", nullptr}));
}

TEST(Value, NotANumberIsSafeEverywhere) {
    const double nan = std::numeric_limits<double>::quiet_NaN();
    EXPECT_NE(Value(nan), Value(nan));
    EXPECT_NE(Value(nan), Value(0));
    EXPECT_NE(Value(std::uint64_t{0}), Value(nan));
    EXPECT_EQ(Value(nan).asInt64(), 0);
    EXPECT_EQ(Value(1e300).asInt64(), std::numeric_limits<std::int64_t>::max());
    EXPECT_EQ(Value(-1e300).asInt64(), std::numeric_limits<std::int64_t>::min());
    EXPECT_EQ(Value(nan).description(), "nan");
    EXPECT_EQ(Value(Date{nan}).description(), "nan");
}

TEST(Value, BoolValueReadsNumbersAndStringsTheWayABooleanReaderDoes) {
    EXPECT_TRUE(Value(0.1).boolValue());
    EXPECT_TRUE(Value("YES").boolValue());
    EXPECT_TRUE(Value("  +007").boolValue());
    EXPECT_FALSE(Value("-0").boolValue());
    EXPECT_FALSE(Value("no").boolValue());
    EXPECT_FALSE(Value("").boolValue());
    EXPECT_FALSE(Value(Array{1}).boolValue());
}

TEST(Dictionary, KeepsInsertionOrderWhenAKeyIsOverwrittenAndAppendsAfterErase) {
    Dictionary d;
    d.set("c", 1);
    d.set("a", 2);
    d.set("b", 3);
    d.set("a", "two");
    EXPECT_EQ(keysOf(d), (std::vector<std::string>{"c", "a", "b"}));
    EXPECT_EQ(*d.find("a"), Value("two"));

    EXPECT_TRUE(d.erase("c"));
    EXPECT_FALSE(d.erase("c"));
    d.set("c", 4);
    EXPECT_EQ(keysOf(d), (std::vector<std::string>{"a", "b", "c"}));

    // The first position of a repeated key wins, with the last value.
    const Dictionary fromList{{"x", 1}, {"y", 2}, {"x", 3}};
    EXPECT_EQ(keysOf(fromList), (std::vector<std::string>{"x", "y"}));
    EXPECT_EQ(*fromList.find("x"), Value(3));

    Dictionary merged{{"k", 1}, {"m", 2}};
    merged.merge(Dictionary{{"n", 3}, {"k", 4}});
    EXPECT_EQ(keysOf(merged), (std::vector<std::string>{"k", "m", "n"}));
    EXPECT_EQ(*merged.find("k"), Value(4));
}

TEST(Dictionary, LargeDictionariesFindEraseAndOverwriteCorrectly) {
    constexpr int kCount = 5000;
    Dictionary d;
    for (int i = 0; i < kCount; ++i) {
        d.set("key" + std::to_string(i), i);
    }
    ASSERT_EQ(d.size(), static_cast<std::size_t>(kCount));
    for (int i = 0; i < kCount; i += 7) {
        const Value* v = d.find("key" + std::to_string(i));
        ASSERT_NE(v, nullptr) << i;
        EXPECT_EQ(*v, Value(i));
    }
    EXPECT_EQ(d.find("key5000"), nullptr);

    for (int i = 0; i < kCount; i += 3) {
        ASSERT_TRUE(d.erase("key" + std::to_string(i)));
    }
    // Positions moved under the index: every survivor must still be found with its own value,
    // and the erased ones must stay gone.
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
    EXPECT_EQ(d.begin()->first, "key1");
    EXPECT_EQ(d.begin()->second, Value("overwritten"));
    d.set("key0", "back");
    EXPECT_EQ(std::prev(d.end())->first, "key0");
    EXPECT_EQ(d.size(), static_cast<std::size_t>(kCount - (kCount + 2) / 3 + 1));

    // Shrinking to a small dictionary and growing again crosses the indexing threshold twice.
    Dictionary small;
    for (int i = 0; i < 40; ++i) {
        small.set(std::to_string(i), i);
    }
    for (int i = 0; i < 35; ++i) {
        small.erase(std::to_string(i));
    }
    for (int i = 100; i < 130; ++i) {
        small.set(std::to_string(i), i);
    }
    EXPECT_EQ(small.size(), 35u);
    EXPECT_EQ(*small.find("39"), Value(39));
    EXPECT_EQ(*small.find("129"), Value(129));
    EXPECT_EQ(small.find("0"), nullptr);
    small.clear();
    EXPECT_EQ(small.find("39"), nullptr);
    small.set("z", 1);
    EXPECT_EQ(*small.find("z"), Value(1));
}

TEST(Dictionary, EqualityIgnoresOrderButNotContent) {
    const Dictionary a{{"x", 1}, {"y", "s"}};
    EXPECT_EQ(a, (Dictionary{{"y", "s"}, {"x", 1.0}}));
    EXPECT_NE(a, (Dictionary{{"x", 1}}));
    EXPECT_NE(a, (Dictionary{{"x", 1}, {"z", "s"}}));
    EXPECT_NE(a, (Dictionary{{"x", "1"}, {"y", "s"}}));
    EXPECT_EQ(Value(a), Value(Dictionary{{"y", "s"}, {"x", 1}}));
}

TEST(Value, DescriptionPrintsThePropertyListStyleText) {
    EXPECT_EQ(Value(nullptr).description(), "<null>");
    EXPECT_EQ(Value(true).description(), "1");
    EXPECT_EQ(Value(std::numeric_limits<std::uint64_t>::max()).description(),
              "18446744073709551615");
    EXPECT_EQ(Value(0.1).description(), "0.1");
    EXPECT_EQ(Value("").description(), "\"\"");
    EXPECT_EQ(Value("say \"hi\"\n").description(), "\"say \\\"hi\\\"\\n\"");
    EXPECT_EQ(Value(Bytes{0x0a, 0xff}).description(), "{length = 2, bytes = 0x0aff}");
    EXPECT_EQ(Value(Date{1706707501.9}).description(), "2024-01-31 13:25:01 +0000");
    EXPECT_EQ(Value(Array{1, "a b"}).description(), "(\n    1,\n    \"a b\"\n)");
    const Dictionary d{{"k", 1}, {"nested", Dictionary{{"in", Array{2}}}}};
    EXPECT_EQ(
        d.description(),
        "{\n    k = 1;\n    nested = {\n        in = (\n            2\n        );\n    };\n}");
}

TEST(Value, CopiesShareNestedContainersButDeepCopiesShareNothing) {
    const Value original(
        Dictionary{{"list", Array{Bytes{1, 2}, Dictionary{{"k", "v"}}}}, {"n", 1}});
    const Value shallow = original;
    EXPECT_EQ(shallow.asDictionary(), original.asDictionary());

    const Value deep = original.deepCopy();
    EXPECT_EQ(deep, original);
    ASSERT_NE(deep.asDictionary(), nullptr);
    EXPECT_NE(deep.asDictionary(), original.asDictionary());
    const Array* deepList = deep.asDictionary()->find("list")->asArray();
    const Array* originalList = original.asDictionary()->find("list")->asArray();
    ASSERT_NE(deepList, nullptr);
    EXPECT_NE(deepList, originalList);
    EXPECT_NE((*deepList)[0].asBytes(), (*originalList)[0].asBytes());
    EXPECT_NE((*deepList)[1].asDictionary(), (*originalList)[1].asDictionary());
    EXPECT_EQ(*(*deepList)[0].asBytes(), (Bytes{1, 2}));
}

TEST(Value, ValueCountAndDepthMeasureNesting) {
    EXPECT_EQ(Value(1).valueCount(), 1u);
    EXPECT_EQ(Value(1).depth(), 0u);
    EXPECT_EQ(Value(Array{}).valueCount(), 1u);
    EXPECT_EQ(Value(Array{}).depth(), 1u);
    const Value v(Dictionary{{"a", Array{1, Dictionary{{"b", 2}}}}, {"c", "s"}});
    EXPECT_EQ(v.valueCount(), 6u);  // dict, array, 1, inner dict, 2, "s"
    EXPECT_EQ(v.depth(), 3u);

    Value deep(1);
    for (int i = 0; i < 20; ++i) {
        deep = Value(Array{deep});
    }
    EXPECT_EQ(deep.depth(), 20u);
    EXPECT_EQ(deep.valueCount(), 21u);
}

}  // namespace
}  // namespace qv

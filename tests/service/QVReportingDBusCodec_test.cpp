#include "service/QVReportingDBusCodec.h"

#include <gtest/gtest.h>

#include "service/RawMessage.h"

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include <sdbus-c++/Types.h>

namespace qv {
namespace {

constexpr std::size_t kBytes = 1024 * 1024;

// A sealed a{sv} holding one entry, key "k", whose variant the writer fills.
sdbus::PlainMessage payload(const std::string& signature,
                            const std::function<void(sdbus::Message&)>& write) {
    sdbus::PlainMessage m = sdbus::createPlainMessage();
    m.openContainer("{sv}");
    m.openDictEntry("sv");
    m << std::string("k");
    m.openVariant(signature);
    write(m);
    m.closeVariant();
    m.closeDictEntry();
    m.closeContainer();
    m.seal();
    return m;
}

QVReportingDecodeResult decode(sdbus::Message& m, std::size_t maxValues, std::size_t maxDepth) {
    m.rewind(true);
    return QVReportingReadDictionary(RawMessage::of(m), {kBytes, maxValues, maxDepth});
}

// What the daemon writes back must read again under the limits the client's payload met.
void expectRereads(const Dictionary& dictionary, std::size_t maxValues, std::size_t maxDepth) {
    sdbus::PlainMessage again = sdbus::createPlainMessage();
    ASSERT_GE(QVReportingAppendDictionary(RawMessage::of(again), dictionary), 0);
    again.seal();
    const QVReportingDecodeResult reread = decode(again, maxValues, maxDepth);
    ASSERT_FALSE(reread.error) << reread.error->message;
    EXPECT_EQ(Value(reread.dictionary), Value(dictionary));
}

TEST(AQVReportingDBusCodec, CountsPairsOfNonStringKeysAsTheDecodedPayloadHoldsThem) {
    // {"k": {1: 2, 3: 4}} as a{ii} becomes [[1, 2], [3, 4]]: three levels, seven values.
    sdbus::PlainMessage m = payload("a{ii}", [](sdbus::Message& w) {
        w << std::map<std::int32_t, std::int32_t>{{1, 2}, {3, 4}};
    });

    const QVReportingDecodeResult shallow = decode(m, 10000, 2);
    ASSERT_TRUE(shallow.error);
    EXPECT_EQ(shallow.limit, QVReportingStats::Limit::PayloadDepth);
    EXPECT_TRUE(shallow.dictionary.empty());

    const QVReportingDecodeResult few = decode(m, 6, 16);
    ASSERT_TRUE(few.error);
    EXPECT_EQ(few.limit, QVReportingStats::Limit::PayloadValues);

    const QVReportingDecodeResult fits = decode(m, 7, 3);
    ASSERT_FALSE(fits.error) << fits.error->message;
    Dictionary expected;
    expected.set("k",
                 Value(Array{Value(Array{Value(1), Value(2)}), Value(Array{Value(3), Value(4)})}));
    EXPECT_EQ(Value(fits.dictionary), Value(expected));
    EXPECT_EQ(Value(fits.dictionary).depth(), 3u);
    EXPECT_EQ(Value(fits.dictionary).valueCount() - 1, 7u);
    expectRereads(fits.dictionary, 7, 3);
}

TEST(AQVReportingDBusCodec, CountsWhatVariantsHoldNotTheirWrapping) {
    // A variant in a variant in a variant holds one number: one value.
    sdbus::PlainMessage nested = payload("v", [](sdbus::Message& w) {
        w.openVariant("v");
        w << sdbus::Variant(std::int64_t{5});
        w.closeVariant();
    });
    const QVReportingDecodeResult one = decode(nested, 1, 1);
    ASSERT_FALSE(one.error) << one.error->message;
    const Value* k = one.dictionary.find("k");
    ASSERT_NE(k, nullptr);
    EXPECT_EQ(k->kind(), Value::Kind::Int);
    EXPECT_EQ(*k, Value(5));
    EXPECT_EQ(one.dictionary.size(), 1u);
    expectRereads(one.dictionary, 1, 1);

    // An array of two numbers is three values and two levels, at the limits and just past them.
    sdbus::PlainMessage array = payload("ax", [](sdbus::Message& w) {
        w << std::vector<std::int64_t>{7, 8};
    });
    const QVReportingDecodeResult atLimits = decode(array, 3, 2);
    ASSERT_FALSE(atLimits.error) << atLimits.error->message;
    expectRereads(atLimits.dictionary, 3, 2);
    EXPECT_EQ(decode(array, 2, 2).limit, QVReportingStats::Limit::PayloadValues);
    EXPECT_EQ(decode(array, 3, 1).limit, QVReportingStats::Limit::PayloadDepth);
}

TEST(AQVReportingDBusCodec, KeepsARepeatedKeyOnceAndSizesEachPayloadToItsOwnEntries) {
    // Entries in the order given; a key given twice keeps its first place and its last value.
    auto entries = [](std::vector<std::pair<std::string, std::int64_t>> items) {
        sdbus::PlainMessage m = sdbus::createPlainMessage();
        m.openContainer("{sv}");
        for (const auto& [key, value] : items) {
            m.openDictEntry("sv");
            m << key << sdbus::Variant(value);
            m.closeDictEntry();
        }
        m.closeContainer();
        m.seal();
        return m;
    };
    sdbus::PlainMessage small = entries({{"a", 1}, {"b", 2}, {"a", 3}});
    const QVReportingDecodeResult first = decode(small, 10000, 16);
    ASSERT_FALSE(first.error) << first.error->message;
    EXPECT_EQ(Value(first.dictionary), Value(Dictionary{{"a", 3}, {"b", 2}}));
    EXPECT_EQ(first.dictionary.begin()->first, "a");

    // A small payload read after a large one holds no room the large one needed.
    std::vector<std::pair<std::string, std::int64_t>> many;
    for (int i = 0; i < 40; ++i) {
        many.emplace_back("key" + std::to_string(i), i);
    }
    sdbus::PlainMessage large = entries(many);
    EXPECT_EQ(decode(large, 10000, 16).dictionary.size(), 40u);
    const QVReportingDecodeResult after = decode(small, 10000, 16);
    EXPECT_EQ(Value(after.dictionary), Value(first.dictionary));
    EXPECT_EQ(after.dictionary.approximateHeapBytes(), first.dictionary.approximateHeapBytes());
}

}  // namespace
}  // namespace qv

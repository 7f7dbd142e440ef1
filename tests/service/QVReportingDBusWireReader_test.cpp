#include "service/QVReportingDBusWireReader.h"

#include <gtest/gtest.h>

#include "service/RawMessage.h"

#include <cstring>
#include <functional>
#include <map>

#include <sdbus-c++/Types.h>

#include "service/QVReportingDBusMessageBytes.h"

namespace qv {
namespace {

constexpr QVReportingInputBudget kRoomy{1 << 20, 10000, 16};

// A message body written by hand, in either byte order.
class Body {
  public:
    explicit Body(bool big) : big_(big) {}
    std::vector<std::uint8_t> bytes;

    Body& pad(std::size_t to) {
        bytes.resize((bytes.size() + to - 1) / to * to);
        return *this;
    }
    Body& n(std::uint64_t v, std::size_t size) {
        pad(size);
        for (std::size_t i = 0; i < size; ++i) {
            bytes.push_back(static_cast<std::uint8_t>(v >> (8 * (big_ ? size - 1 - i : i))));
        }
        return *this;
    }
    Body& s(std::string_view text) {
        n(text.size(), 4);
        bytes.insert(bytes.end(), text.begin(), text.end());
        bytes.push_back(0);
        return *this;
    }
    Body& g(std::string_view text) {
        bytes.push_back(static_cast<std::uint8_t>(text.size()));
        bytes.insert(bytes.end(), text.begin(), text.end());
        bytes.push_back(0);
        return *this;
    }
    // An array: its length patched in once the items are written.
    Body& array(std::size_t itemAlignment, const std::function<void(Body&)>& items) {
        n(0, 4);
        const std::size_t at = bytes.size() - 4;
        pad(itemAlignment);
        const std::size_t start = bytes.size();
        items(*this);
        Body length(big_);
        length.n(bytes.size() - start, 4);
        std::memcpy(bytes.data() + at, length.bytes.data(), 4);
        return *this;
    }
    // A payload of one entry: key, then a variant of the given signature.
    Body& entry(std::string_view key, std::string_view signature,
                const std::function<void(Body&)>& value) {
        pad(8).s(key).g(signature);
        value(*this);
        return *this;
    }

  private:
    bool big_;
};

QVReportingDecodeResult readBody(const Body& body, bool big, std::string signature = "a{sv}",
                                 const QVReportingInputBudget& budget = kRoomy) {
    return QVReportingDBusWireReader::readArguments({big, std::move(signature), body.bytes},
                                                    budget);
}

// {key: value} as a one-entry payload, read back.
QVReportingDecodeResult readOne(bool big, std::string_view key, std::string_view signature,
                                const std::function<void(Body&)>& value,
                                const QVReportingInputBudget& budget = kRoomy) {
    Body body(big);
    body.array(8, [&](Body& b) { b.entry(key, signature, value); });
    return readBody(body, big, "a{sv}", budget);
}

TEST(AQVReportingDBusWireReader, ReadsEveryTypeInEitherByteOrderAsTheCodecDoes) {
    double half = 0.5;
    std::uint64_t halfBits = 0;
    std::memcpy(&halfBits, &half, 8);
    struct Case {
        const char* signature;
        std::function<void(Body&)> write;
        Value expected;
    };
    const std::vector<Case> cases = {
        {"b", [](Body& b) { b.n(1, 4); }, Value(true)},
        {"y", [](Body& b) { b.n(200, 1); }, Value(200)},
        {"n", [](Body& b) { b.n(0xFFFE, 2); }, Value(-2)},
        {"q", [](Body& b) { b.n(0xFFFE, 2); }, Value(65534)},
        {"i", [](Body& b) { b.n(0xFFFFFFFF, 4); }, Value(-1)},
        {"u", [](Body& b) { b.n(0xFFFFFFFF, 4); }, Value(std::int64_t{0xFFFFFFFF})},
        {"x", [](Body& b) { b.n(0xFFFFFFFFFFFFFFFE, 8); }, Value(-2)},
        {"t", [](Body& b) { b.n(0xFFFFFFFFFFFFFFFE, 8); }, Value(0xFFFFFFFFFFFFFFFEull)},
        {"d", [&](Body& b) { b.n(halfBits, 8); }, Value(0.5)},
        {"s", [](Body& b) { b.s("h\xC3\xA9"); }, Value("h\xC3\xA9")},
        {"o", [](Body& b) { b.s("/a/b_1"); }, Value("/a/b_1")},
        {"g", [](Body& b) { b.g("a{sv}(i)"); }, Value("a{sv}(i)")},
        {"ay", [](Body& b) { b.array(1, [](Body& a) { a.n(1, 1).n(2, 1); }); }, Value(Bytes{1, 2})},
        // The empty array still pads to its items' alignment.
        {"(axy)", [](Body& b) { b.pad(8).array(8, [](Body&) {}).n(7, 1); },
         Value(Array{Value(Array{}), Value(7)})},
        {"(yx)", [](Body& b) { b.pad(8).n(1, 1).n(9, 8); }, Value(Array{Value(1), Value(9)})},
        {"av", [](Body& b) { b.array(1, [](Body& a) { a.g("s").s("one").g("q").n(2, 2); }); },
         Value(Array{Value("one"), Value(2)})},
        {"a{sq}",
         [](Body& b) {
             b.array(8, [](Body& a) { a.pad(8).s("a").n(1, 2).pad(8).s("b").n(2, 2); });
         },
         Value([] {
             Dictionary d;
             d.set("a", Value(1));
             d.set("b", Value(2));
             return d;
         }())},
        {"a{yv}", [](Body& b) { b.array(8, [](Body& a) { a.pad(8).n(3, 1).g("b").n(0, 4); }); },
         Value(Array{Value(Array{Value(3), Value(false)})})},
        {"v", [](Body& b) { b.g("v").g("x").n(5, 8); }, Value(5)},
    };
    for (const bool big : {false, true}) {
        for (const Case& c : cases) {
            SCOPED_TRACE(std::string(c.signature) + (big ? " big-endian" : " little-endian"));
            const QVReportingDecodeResult r = readOne(big, "k", c.signature, c.write);
            ASSERT_FALSE(r.error) << r.error->message;
            const Value* k = r.dictionary.find("k");
            ASSERT_NE(k, nullptr);
            EXPECT_EQ(k->kind(), c.expected.kind());
            EXPECT_EQ(*k, c.expected);
        }
    }
}

TEST(AQVReportingDBusWireReader, TakesNoncharactersAndRefusesWhatIsNotUtf8NamingTheKey) {
    const std::vector<std::string> taken = {"\xEF\xBF\xBF", "\xEF\xBF\xBE",     "\xEF\xB7\x90",
                                            "\xEF\xB7\xAF", "\xF0\x9F\xBF\xBE", "\xF4\x8F\xBF\xBF",
                                            "\x7F",         "\xED\x9F\xBF",     "\xEE\x80\x80"};
    const std::vector<std::string> refused = {"\xFF",
                                              "\xC0\x80",
                                              "\xC1\xBF",
                                              "\xE0\x9F\xBF",
                                              "\xED\xA0\x80",
                                              "\xED\xBF\xBF",
                                              "\xF4\x90\x80\x80",
                                              "\xF5\x80\x80\x80",
                                              "\xE2\x82",
                                              "\x80",
                                              std::string("a\0b", 3)};
    for (const bool big : {false, true}) {
        for (const std::string& text : taken) {
            const QVReportingDecodeResult value =
                readOne(big, "k", "s", [&](Body& b) { b.s(text); });
            ASSERT_FALSE(value.error) << value.error->message;
            EXPECT_EQ(*value.dictionary.find("k"), Value(text));
            const QVReportingDecodeResult key = readOne(big, "k" + text, "a{sv}", [&](Body& b) {
                b.array(8, [&](Body& a) { a.entry(text, "s", [&](Body& v) { v.s(text); }); });
            });
            ASSERT_FALSE(key.error) << key.error->message;
            const Value* inner = key.dictionary.find("k" + text);
            ASSERT_TRUE(inner && inner->asDictionary());
            EXPECT_EQ(*inner->asDictionary()->find(text), Value(text));
        }
        for (const std::string& text : refused) {
            SCOPED_TRACE(testing::PrintToString(text));
            const QVReportingDecodeResult value = readOne(big, "named", "av", [&](Body& b) {
                b.array(1, [&](Body& a) { a.g("s").s(text); });
            });
            ASSERT_TRUE(value.error);
            EXPECT_FALSE(value.limit);
            EXPECT_EQ(value.error->name, QVReportingError::invalidArgs("").name);
            EXPECT_NE(value.error->message.find("\"named\""), std::string::npos);
            EXPECT_TRUE(value.dictionary.empty());
            Body keys(big);
            keys.array(8, [&](Body& b) {
                b.entry("first", "b", [](Body& v) { v.n(1, 4); });
                b.entry(text, "b", [](Body& v) { v.n(1, 4); });
            });
            const QVReportingDecodeResult key = readBody(keys, big);
            ASSERT_TRUE(key.error);
            EXPECT_NE(key.error->message.find("after \"first\""), std::string::npos);
        }
    }
}

TEST(AQVReportingDBusWireReader, RefusesMalformedPathsSignaturesAndNesting) {
    const std::vector<std::pair<const char*, std::function<void(Body&)>>> refused = {
        {"o", [](Body& b) { b.s("a/b"); }},
        {"o", [](Body& b) { b.s("/a/"); }},
        {"o", [](Body& b) { b.s("/a//b"); }},
        {"o", [](Body& b) { b.s("/a-b"); }},
        {"g", [](Body& b) { b.g("a"); }},
        {"g", [](Body& b) { b.g("()"); }},
        {"g", [](Body& b) { b.g("{sv}"); }},
        {"g", [](Body& b) { b.g("a{vs}"); }},
        {"g",
         [](Body& b) {
             std::string tooDeep(34, 'a');  // 33 arrays deep, gcc 12 misreads "+" here at -O2
             tooDeep.back() = 'y';
             b.g(tooDeep);
         }},
        {"v", [](Body& b) { b.g("ss").s("a").s("b"); }},
        {"v", [](Body& b) { b.g("").n(0, 1); }},
        {"h", [](Body& b) { b.n(0, 4); }},
    };
    for (const auto& [signature, write] : refused) {
        SCOPED_TRACE(signature);
        const QVReportingDecodeResult r = readOne(false, "k", signature, write);
        ASSERT_TRUE(r.error);
        EXPECT_FALSE(r.limit);
        EXPECT_NE(r.error->message.find("\"k\""), std::string::npos) << r.error->message;
    }
    // Variants in variants: 64 containers in all are what the bus lets through, no more.
    for (const int variants : {61, 62}) {
        const QVReportingDecodeResult r = readOne(false, "k", "v", [&](Body& b) {
            for (int i = 1; i < variants; ++i) {
                b.g("v");
            }
            b.g("y").n(1, 1);
        });
        EXPECT_EQ(!r.error, variants == 61) << variants;
    }
}

TEST(AQVReportingDBusWireReader, RefusesEveryTruncationOfABodyAndOfAMessage) {
    for (const bool big : {false, true}) {
        Body body(big);
        body.array(8, [](Body& b) {
            b.entry("k", "(sx)", [](Body& v) { v.pad(8).s("text").n(1, 8); });
            b.entry("a", "ay", [](Body& v) { v.array(1, [](Body& a) { a.n(1, 1).n(2, 1); }); });
        });
        ASSERT_FALSE(readBody(body, big).error);
        for (std::size_t size = 0; size < body.bytes.size(); ++size) {
            Body cut(big);
            cut.bytes.assign(body.bytes.begin(), body.bytes.begin() + size);
            const QVReportingDecodeResult r = readBody(cut, big);
            EXPECT_TRUE(r.error) << size;
            EXPECT_TRUE(r.dictionary.empty());
        }
    }
    // A whole message, had from sd-bus, split at every length short of its end.
    sdbus::PlainMessage m = sdbus::createPlainMessage();
    m << std::map<std::string, sdbus::Variant>{{"k", sdbus::Variant(std::string("v"))}};
    m.seal();
    auto bytes = QVReportingDBusMessageBytes::forThisThread().of(RawMessage::of(m));
    ASSERT_TRUE(bytes);
    ASSERT_TRUE(QVReportingDBusWireReader::split(*bytes));
    for (std::size_t size = 0; size < bytes->size(); ++size) {
        EXPECT_FALSE(QVReportingDBusWireReader::split(std::span(*bytes).first(size))) << size;
    }
}

// Messages sd-bus reads, read both ways under budgets that each hold or each cut something.
TEST(AQVReportingDBusWireReader, AgreesWithTheCodecOnLimitsAndRestOnWhatSdBusReads) {
    sdbus::PlainMessage m = sdbus::createPlainMessage();
    m.openContainer("{sv}");
    for (int i = 0; i < 3; ++i) {
        m.openDictEntry("sv");
        m << "key" + std::to_string(i);
        m << sdbus::Variant(
            std::map<std::int32_t, std::vector<std::string>>{{i, {"a", "bb"}}, {i + 1, {}}});
        m.closeDictEntry();
    }
    m.closeContainer();
    m << std::uint32_t{7} << std::uint16_t{9} << std::vector<std::int64_t>{-1, 1};
    m.seal();
    auto bytes = QVReportingDBusMessageBytes::forThisThread().of(RawMessage::of(m));
    ASSERT_TRUE(bytes);
    const auto wire = QVReportingDBusWireReader::split(*bytes);
    ASSERT_TRUE(wire);
    EXPECT_EQ(wire->signature, "a{sv}uqax");

    for (std::size_t maxBytes : {std::size_t{1} << 20, std::size_t{40}, std::size_t{120}}) {
        for (std::size_t maxValues : {10000, 20, 8}) {
            for (std::size_t maxDepth : {16, 4, 3}) {
                const QVReportingInputBudget budget{maxBytes, maxValues, maxDepth};
                SCOPED_TRACE(testing::Message() << maxBytes << " " << maxValues << " " << maxDepth);
                m.rewind(true);
                const QVReportingDecodeResult codec =
                    QVReportingReadDictionary(RawMessage::of(m), budget);
                const QVReportingDecodeResult read =
                    QVReportingDBusWireReader::readArguments(*wire, budget);
                EXPECT_EQ(Value(read.dictionary), Value(codec.dictionary));
                EXPECT_EQ(read.limit, codec.limit);
                ASSERT_EQ(!read.error, !codec.error);
                if (codec.error) {
                    EXPECT_EQ(read.error->message, codec.error->message);
                    continue;
                }
                ASSERT_FALSE(codec.rest);
                std::uint32_t category = 0, wireCategory = 0;
                std::uint16_t type = 0, wireType = 0;
                std::vector<std::int64_t> ids, wireIds;
                ASSERT_TRUE(QVReportingReadRest(RawMessage::of(m), codec, category, type, ids));
                ASSERT_TRUE(
                    QVReportingReadRest(RawMessage::of(m), read, wireCategory, wireType, wireIds));
                EXPECT_EQ(std::tie(wireCategory, wireType, wireIds), std::tie(category, type, ids));
                EXPECT_EQ(std::tie(category, type, ids),
                          std::tuple(7u, 9, std::vector<std::int64_t>{-1, 1}));
            }
        }
    }
}

}  // namespace
}  // namespace qv

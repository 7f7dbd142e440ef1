#include "session/DataSerialize.h"

#include <gtest/gtest.h>
#include <plist/plist.h>

#include <cmath>
#include <cstdint>
#include <cstring>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "values/Base64.h"

namespace qv {
namespace {

// A node read by the library, as a Value (integers come back signed).
Value fromPlist(plist_t node) {
    // The library hands out malloc'd strings and buffers.
    const auto take = [](char* p, std::size_t n) {
        std::string out(p, n);
        free(p);
        return out;
    };
    char* p = nullptr;
    switch (plist_get_node_type(node)) {
        case PLIST_DICT: {
            Dictionary d;
            plist_dict_iter it = nullptr;
            plist_dict_new_iter(node, &it);
            plist_t item = nullptr;
            for (plist_dict_next_item(node, it, &p, &item); p;
                 plist_dict_next_item(node, it, &p, &item)) {
                const std::string key = take(p, strlen(p));
                d.set(key, fromPlist(item));
            }
            free(it);
            return Value(std::move(d));
        }
        case PLIST_ARRAY: {
            Array a;
            for (std::uint32_t i = 0; i < plist_array_get_size(node); ++i)
                a.push_back(fromPlist(plist_array_get_item(node, i)));
            return Value(std::move(a));
        }
        case PLIST_STRING:
            plist_get_string_val(node, &p);
            return Value(take(p, strlen(p)));
        case PLIST_BOOLEAN: {
            std::uint8_t b = 0;
            plist_get_bool_val(node, &b);
            return Value(b != 0);
        }
        case PLIST_UINT: {
            std::uint64_t u = 0;
            plist_get_uint_val(node, &u);
            return Value(static_cast<std::int64_t>(u));
        }
        case PLIST_REAL: {
            double d = 0;
            plist_get_real_val(node, &d);
            return Value(d);
        }
        case PLIST_DATA: {
            std::uint64_t n = 0;
            plist_get_data_val(node, &p, &n);
            const std::string data = take(p, n);
            return Value(Bytes(data.begin(), data.end()));
        }
        case PLIST_DATE: {
            std::int32_t sec = 0, usec = 0;
            plist_get_date_val(node, &sec, &usec);
            return Value(Date{978307200.0 + sec + usec / 1e6});
        }
        default:
            return Value("<unexpected node>");
    }
}

// The XML read back by the library, as a Value again.
std::optional<Value> readBack(const Bytes& xml) {
    plist_t root = nullptr;
    plist_from_xml(reinterpret_cast<const char*>(xml.data()),
                   static_cast<std::uint32_t>(xml.size()), &root);
    if (!root) {
        return std::nullopt;
    }
    Value v = fromPlist(root);
    plist_free(root);
    return v;
}

std::string text(const Bytes& bytes) {
    return std::string(bytes.begin(), bytes.end());
}

// The text of the one <date> element in the serialisation of a date.
std::string dateText(double secondsSince1970) {
    const auto xml = DataSerialize::getXMLInfo(Value(Date{secondsSince1970}));
    if (!xml) {
        return "<none>";
    }
    const auto begin = xml->find("<date>");
    const auto end = xml->find("</date>");
    return begin == std::string::npos ? "<no date>" : xml->substr(begin + 6, end - begin - 6);
}

TEST(DataSerialize, WritesAnXmlPropertyListThatReadsBackWithEveryKindInOrder) {
    const Dictionary payload{
        {"zeta", "text <&> \"quoted\""},
        {"count", -5},
        {"min", std::numeric_limits<std::int64_t>::min()},
        {"ratio", 0.1},
        {"flag", true},
        {"blob", Bytes{0x00, 0x01, 0xfe, 0xff}},
        {"empty", Bytes{}},
        {"when", Date{1706707501}},
        {"list", Array{1, "two", Dictionary{{"three", 3.5}}}},
        {"alpha", Dictionary{}},
    };
    const auto blob = DataSerialize::getPlistBlob(Value(payload));
    ASSERT_TRUE(blob.has_value());
    const std::string xml = text(*blob);
    EXPECT_EQ(xml.rfind("<?xml version=\"1.0\" encoding=\"UTF-8\"?>", 0), 0u);
    EXPECT_NE(xml.find("<plist version=\"1.0\">"), std::string::npos);

    const auto back = readBack(*blob);
    ASSERT_TRUE(back.has_value());
    EXPECT_EQ(*back, Value(payload)) << back->description();
    std::vector<std::string> keys;
    for (const auto& entry : *back->asDictionary()) {
        keys.push_back(entry.first);
    }
    EXPECT_EQ(keys, (std::vector<std::string>{"zeta", "count", "min", "ratio", "flag", "blob",
                                              "empty", "when", "list", "alpha"}));
    // A scalar is a property list of its own.
    EXPECT_EQ(readBack(DataSerialize::getPlistBlob(Value("solo")).value()), Value("solo"));
}

TEST(DataSerialize, UnsignedIntegersAboveTheSignedRangeStayPositive) {
    const auto xml = DataSerialize::getXMLInfo(Value(Array{
        std::numeric_limits<std::uint64_t>::max(), std::uint64_t{1} << 63, std::uint64_t{7}}));
    ASSERT_TRUE(xml.has_value());
    EXPECT_NE(xml->find("<integer>18446744073709551615</integer>"), std::string::npos);
    EXPECT_NE(xml->find("<integer>9223372036854775808</integer>"), std::string::npos);
    EXPECT_NE(xml->find("<integer>7</integer>"), std::string::npos);
    EXPECT_EQ(xml->find("<integer>-"), std::string::npos);
}

TEST(DataSerialize, WritesDatesToTheSecondAcrossTheWholeFourDigitYearRange) {
    EXPECT_EQ(dateText(978307200), "2001-01-01T00:00:00Z");
    EXPECT_EQ(dateText(0), "1970-01-01T00:00:00Z");
    EXPECT_EQ(dateText(1706707501.9), "2024-01-31T13:25:01Z");
    EXPECT_EQ(dateText(978307199.5), "2000-12-31T23:59:59Z");
    // Outside the library's 32-bit seconds from 2001.
    EXPECT_EQ(dateText(4102444800), "2100-01-01T00:00:00Z");
    EXPECT_EQ(dateText(-5364662400), "1800-01-01T00:00:00Z");
    EXPECT_EQ(dateText(253402300799), "9999-12-31T23:59:59Z");
    EXPECT_EQ(dateText(253402300800), "<none>");  // year 10000
    EXPECT_EQ(dateText(-30610224001), "<none>");  // year 999
    EXPECT_EQ(dateText(std::numeric_limits<double>::quiet_NaN()), "<none>");
    EXPECT_EQ(dateText(std::numeric_limits<double>::infinity()), "<none>");
    EXPECT_EQ(dateText(1e300), "<none>");
}

TEST(DataSerialize, AnythingThatIsNotAPropertyListGivesNothingInEveryForm) {
    const std::vector<Value> refused{
        Value(nullptr),
        Value(Array{1, nullptr}),
        Value(Dictionary{{"ok", 1}, {"deep", Dictionary{{"list", Array{Value()}}}}}),
        Value(std::string("nul\0inside", 10)),
        Value(Dictionary{{std::string("key\0nul", 7), 1}}),
        Value(Array{Date{std::numeric_limits<double>::quiet_NaN()}}),
    };
    for (const Value& v : refused) {
        EXPECT_EQ(DataSerialize::getPlistBlob(v), std::nullopt) << v.description();
        EXPECT_EQ(DataSerialize::getXMLInfo(v), std::nullopt);
        EXPECT_EQ(DataSerialize::getDataXMLInfo(v), std::nullopt);
        EXPECT_EQ(DataSerialize::getBase64XMLBlob(v), std::nullopt);
    }
}

TEST(DataSerialize, TextFormsCheckTheirEncodingAndBase64DecodesToTheBlob) {
    const Value ascii(Dictionary{{"name", "plain"}});
    const Value accented(Dictionary{{"name", "caf\xc3\xa9"}});
    const Value broken(Dictionary{{"name", "bad \xff byte"}});

    const auto asciiBlob = DataSerialize::getPlistBlob(ascii);
    ASSERT_TRUE(asciiBlob.has_value());
    EXPECT_EQ(DataSerialize::getXMLInfo(ascii), text(*asciiBlob));
    EXPECT_EQ(DataSerialize::getDataXMLInfo(ascii), text(*asciiBlob));

    EXPECT_EQ(DataSerialize::getXMLInfo(accented), std::nullopt);
    const auto utf8 = DataSerialize::getDataXMLInfo(accented);
    ASSERT_TRUE(utf8.has_value());
    EXPECT_NE(utf8->find("<string>caf\xc3\xa9</string>"), std::string::npos);

    // The blob is made, but it is no text in either encoding.
    EXPECT_TRUE(DataSerialize::getPlistBlob(broken).has_value());
    EXPECT_EQ(DataSerialize::getXMLInfo(broken), std::nullopt);
    EXPECT_EQ(DataSerialize::getDataXMLInfo(broken), std::nullopt);
    for (const char* invalid : {"\xc0\xaf", "\xed\xa0\x80", "\xf4\x90\x80\x80", "\xe2\x82"}) {
        EXPECT_EQ(DataSerialize::getDataXMLInfo(Value(invalid)), std::nullopt) << invalid;
    }
    EXPECT_TRUE(DataSerialize::getDataXMLInfo(Value("\xf0\x9f\x8e\xb5")).has_value());

    const auto base64 = DataSerialize::getBase64XMLBlob(accented);
    ASSERT_TRUE(base64.has_value());
    EXPECT_EQ(base64->find_first_of("\r\n"), std::string::npos);
    EXPECT_EQ(QVReportingBase64Decode(*base64), DataSerialize::getPlistBlob(accented));
}

Bytes bytesOf(std::string_view s) {
    return Bytes(s.begin(), s.end());
}

TEST(Base64, EncodesAndDecodesTheStandardTestVectors) {
    const std::vector<std::pair<std::string, std::string>> vectors{
        {"", ""},
        {"f", "Zg=="},
        {"fo", "Zm8="},
        {"foo", "Zm9v"},
        {"foob", "Zm9vYg=="},
        {"fooba", "Zm9vYmE="},
        {"foobar", "Zm9vYmFy"},
    };
    for (const auto& [plain, encoded] : vectors) {
        EXPECT_EQ(QVReportingBase64Encode(bytesOf(plain)), encoded);
        EXPECT_EQ(QVReportingBase64Decode(encoded), bytesOf(plain)) << encoded;
    }
    // The last two characters of the alphabet, and every byte value through a round trip.
    EXPECT_EQ(QVReportingBase64Encode(Bytes{0xfb, 0xff}), "+/8=");
    Bytes all;
    for (int i = 0; i < 256; ++i) {
        all.push_back(static_cast<std::uint8_t>(i));
    }
    const std::string encoded = QVReportingBase64Encode(all);
    EXPECT_EQ(encoded.size(), 344u);
    EXPECT_EQ(QVReportingBase64Decode(encoded), all);
}

TEST(Base64, RefusesTextThatIsNotCanonical) {
    for (const char* bad : {"Zg", "Zg=", "Zg==Zg==", "Z===", "====", "Zh==", "Zm9=", "Zm9v\n",
                            "Zm9-", "Zm9_", "Zm 9", "Zm9v====", "=Zm9"}) {
        EXPECT_EQ(QVReportingBase64Decode(bad), std::nullopt) << bad;
    }
}

}  // namespace
}  // namespace qv

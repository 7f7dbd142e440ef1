#include "QVReportingJsonVariant.h"

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <vector>

#include <gtest/gtest.h>

namespace qv::client {
namespace {

using Json = nlohmann::ordered_json;

sdbus::Variant convert(const char* text, QVReportingJsonConversionOptions options = {}) {
    return QVReportingJsonToVariant(Json::parse(text), options);
}

std::string conversionError(const char* text, QVReportingJsonConversionOptions options = {},
                            const std::string& path = "payload") {
    try {
        (void)QVReportingJsonToVariant(Json::parse(text), options, path);
    } catch (const QVReportingJsonConversionError& e) {
        return e.what();
    }
    return "(converted)";
}

TEST(AJsonToVariantConversion, SendsIntegersAsSignedUnlessOnlyUnsignedCanHoldThem) {
    const auto int64Max = std::numeric_limits<std::int64_t>::max();
    const auto int64Min = std::numeric_limits<std::int64_t>::min();

    EXPECT_EQ(convert("5").peekValueType(), "x");
    EXPECT_EQ(convert("5").get<std::int64_t>(), 5);
    EXPECT_EQ(convert("-1").get<std::int64_t>(), -1);
    EXPECT_EQ(convert("9223372036854775807").peekValueType(), "x");
    EXPECT_EQ(convert("9223372036854775807").get<std::int64_t>(), int64Max);
    EXPECT_EQ(convert("-9223372036854775808").get<std::int64_t>(), int64Min);
    // One beyond the signed range is the first value that needs t.
    EXPECT_EQ(convert("9223372036854775808").peekValueType(), "t");
    EXPECT_EQ(convert("9223372036854775808").get<std::uint64_t>(), std::uint64_t{1} << 63);
    EXPECT_EQ(convert("18446744073709551615").get<std::uint64_t>(),
              std::numeric_limits<std::uint64_t>::max());
}

TEST(AJsonToVariantConversion, KeepsFractionsBooleansAndStringsApartFromIntegers) {
    // 1.0 is written as a fraction and must stay a double, not collapse to the integer 1.
    EXPECT_EQ(convert("1.0").peekValueType(), "d");
    EXPECT_DOUBLE_EQ(convert("1.0").get<double>(), 1.0);
    EXPECT_DOUBLE_EQ(convert("0.0625").get<double>(), 0.0625);
    EXPECT_EQ(convert("true").peekValueType(), "b");
    EXPECT_TRUE(convert("true").get<bool>());
    EXPECT_EQ(convert("\"16000\"").peekValueType(), "s");
    EXPECT_EQ(convert("\"16000\"").get<std::string>(), "16000");
}

TEST(AJsonToVariantConversion, NestsArraysAsVariantArraysAndObjectsAsDictionaries) {
    const auto variant = convert(R"({"a": [1, "x", {"b": false}], "c": {}})");
    ASSERT_EQ(variant.peekValueType(), "a{sv}");
    const auto map = variant.get<VariantMap>();
    ASSERT_EQ(map.size(), 2u);
    EXPECT_EQ(map.at("a").peekValueType(), "av");
    const auto items = map.at("a").get<std::vector<sdbus::Variant>>();
    ASSERT_EQ(items.size(), 3u);
    EXPECT_EQ(items[1].get<std::string>(), "x");
    EXPECT_FALSE(items[2].get<VariantMap>().at("b").get<bool>());
    EXPECT_TRUE(map.at("c").get<VariantMap>().empty());
}

TEST(AJsonToVariantConversion, ReplacesANowObjectByTheCurrentTimePlusItsOffset) {
    QVReportingJsonConversionOptions options;
    options.now = 1'700'000'000.25;

    const auto map = QVReportingJsonToVariantMap(
        Json::parse(R"({"t": {"$now": -1.5}, "u": {"$now": 0}})"), options);
    EXPECT_EQ(map.at("t").peekValueType(), "d");
    EXPECT_DOUBLE_EQ(map.at("t").get<double>(), 1'699'999'998.75);
    EXPECT_DOUBLE_EQ(map.at("u").get<double>(), 1'700'000'000.25);

    // With a second key it is an ordinary object.
    EXPECT_EQ(convert(R"({"$now": 1, "x": 2})", options).peekValueType(), "a{sv}");
    EXPECT_NE(conversionError(R"({"$now": "soon"})", options).find("number of seconds"),
              std::string::npos);
    // Without a time to count from, it is refused rather than sent as a dictionary.
    EXPECT_NE(conversionError(R"({"$now": 1})").find("not understood"), std::string::npos);
}

TEST(AJsonToVariantConversion, RefusesWhatHasNoDBusFormAndSaysWhere) {
    EXPECT_EQ(conversionError(R"({"list": [1, null]})"), "payload.list[1]: null has no D-Bus form");
    EXPECT_EQ(conversionError("null"), "payload: null has no D-Bus form");
    try {
        (void)QVReportingJsonToVariantMap(Json::parse("[1]"), {}, "config");
        ADD_FAILURE() << "an array is not a dictionary";
    } catch (const QVReportingJsonConversionError& e) {
        EXPECT_STREQ(e.what(), "config: expected a JSON object, found array");
    }
}

TEST(AJsonToVariantConversion, RefusesNestingBeyondItsDepthButNotAtIt) {
    QVReportingJsonConversionOptions options;
    options.maxDepth = 2;
    EXPECT_EQ(convert("[[1]]", options).peekValueType(), "av");
    EXPECT_NE(conversionError("[[[1]]]", options).find("nested more than 2 deep"),
              std::string::npos);
    EXPECT_NE(conversionError(R"({"a": {"b": {"c": 1}}})", options).find("payload.a.b.c"),
              std::string::npos);
}

TEST(AVariantToJsonConversion, ReadsBackWhatTheJsonConversionWrites) {
    const auto original = Json::parse(
        R"({"big": 18446744073709551615, "f": 0.1, "list": [true, "s", -7], "n": {"m": {}}})");
    const auto back = QVReportingVariantToJson(QVReportingJsonToVariant(original));
    EXPECT_EQ(back, original);
    EXPECT_TRUE(back["big"].is_number_unsigned());
    EXPECT_TRUE(back["f"].is_number_float());
}

TEST(AVariantToJsonConversion, ShowsEveryTypeTheDaemonCanAnswerWith) {
    EXPECT_EQ(QVReportingVariantToJson(sdbus::Variant(std::uint16_t{65535})), Json(65535));
    EXPECT_EQ(QVReportingVariantToJson(sdbus::Variant(std::uint32_t{4294967295u})),
              Json(4294967295u));
    EXPECT_EQ(QVReportingVariantToJson(sdbus::Variant(std::int16_t{-2})), Json(-2));
    EXPECT_EQ(QVReportingVariantToJson(sdbus::Variant(std::vector<std::uint8_t>{0, 255})),
              Json::parse("[0, 255]"));
    EXPECT_EQ(QVReportingVariantToJson(sdbus::Variant(sdbus::ObjectPath("/a/b"))), Json("/a/b"));
    // Dictionaries keyed by something other than a string become [key, value] pairs.
    EXPECT_EQ(QVReportingVariantToJson(
                  sdbus::Variant(std::map<std::int64_t, std::string>{{2, "b"}, {1, "a"}})),
              Json::parse(R"([[1, "a"], [2, "b"]])"));
    EXPECT_EQ(QVReportingVariantToJson(sdbus::Variant(
                  sdbus::Struct<std::int32_t, std::string>(std::int32_t{3}, std::string("x")))),
              Json::parse(R"([3, "x"])"));
    // JSON has no NaN.
    EXPECT_TRUE(QVReportingVariantToJson(sdbus::Variant(std::nan(""))).is_null());
    EXPECT_TRUE(QVReportingVariantToJson(sdbus::Variant()).is_null());
}

TEST(AVariantToJsonConversion, TurnsAReporterValidityReplyIntoAnObject) {
    const VariantMap reply = {{"reporterID", sdbus::Variant(std::int64_t{5})},
                              {"serviceType", sdbus::Variant(std::uint16_t{7})}};
    EXPECT_EQ(QVReportingVariantMapToJson(reply),
              Json::parse(R"({"reporterID": 5, "serviceType": 7})"));
}

}  // namespace
}  // namespace qv::client

#include "QVReportingJsonVariant.h"

#include <cstdint>
#include <string>

#include <gtest/gtest.h>

namespace qv::client {
namespace {

using Json = nlohmann::ordered_json;

sdbus::Variant convert(const char* text, QVReportingJsonConversionOptions options = {}) {
    return QVReportingJsonToVariant(Json::parse(text), options);
}

std::string conversionError(const char* text, QVReportingJsonConversionOptions options = {}) {
    try {
        (void)QVReportingJsonToVariant(Json::parse(text), options, "payload");
    } catch (const QVReportingJsonConversionError& e) {
        return e.what();
    }
    return "(converted)";
}

TEST(AJsonToVariantConversion, PicksTheNarrowestFaithfulDBusType) {
    // Signed unless only unsigned can hold it; a written fraction stays a double.
    const std::pair<const char*, const char*> cases[] = {{"-9223372036854775808", "x"},
                                                         {"9223372036854775807", "x"},
                                                         {"9223372036854775808", "t"},
                                                         {"1.0", "d"},
                                                         {"true", "b"},
                                                         {"\"16000\"", "s"},
                                                         {"[1, \"x\"]", "av"},
                                                         {"{}", "a{sv}"}};
    for (const auto& [text, type] : cases) {
        EXPECT_EQ(convert(text).peekValueType(), type) << text;
    }
    EXPECT_EQ(convert("18446744073709551615").get<std::uint64_t>(), UINT64_MAX);

    // What it writes reads back the same.
    const auto original = Json::parse(
        R"({"big": 18446744073709551615, "f": 0.1, "list": [true, "s", -7], "n": {"m": {}}})");
    const auto back = QVReportingVariantToJson(QVReportingJsonToVariant(original));
    EXPECT_EQ(back, original);
    EXPECT_TRUE(back["big"].is_number_unsigned());
    EXPECT_TRUE(back["f"].is_number_float());
}

TEST(AJsonToVariantConversion, ResolvesNowObjectsAndRefusesWhatHasNoDBusFormSayingWhere) {
    QVReportingJsonConversionOptions options;
    options.now = 1'700'000'000.25;
    options.maxDepth = 2;
    const auto map = QVReportingJsonToVariantMap(Json::parse(R"({"t": {"$now": -1.5}})"), options);
    EXPECT_DOUBLE_EQ(map.at("t").get<double>(), 1'699'999'998.75);
    EXPECT_EQ(convert(R"({"$now": 1, "x": 2})", options).peekValueType(), "a{sv}");
    EXPECT_NE(conversionError(R"({"$now": "soon"})", options).find("number of seconds"),
              std::string::npos);
    // Without a time to count from, it is refused rather than sent as a dictionary.
    EXPECT_NE(conversionError(R"({"$now": 1})").find("not understood"), std::string::npos);

    EXPECT_EQ(conversionError(R"({"list": [1, null]})"), "payload.list[1]: null has no D-Bus form");
    EXPECT_EQ(convert("[[1]]", options).peekValueType(), "av");
    EXPECT_NE(conversionError(R"({"a": {"b": {"c": 1}}})", options).find("payload.a.b.c"),
              std::string::npos);
    try {
        (void)QVReportingJsonToVariantMap(Json::parse("[1]"), {}, "config");
        ADD_FAILURE() << "an array is not a dictionary";
    } catch (const QVReportingJsonConversionError& e) {
        EXPECT_STREQ(e.what(), "config: expected a JSON object, found array");
    }
}

}  // namespace
}  // namespace qv::client

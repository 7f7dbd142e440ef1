#include "session/DataSerialize.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>

#include "values/Base64.h"

namespace qv {
namespace {

TEST(DataSerialize, WritesEveryKindEscapedAndInInsertionOrder) {
    const Dictionary payload{
        {"zeta", "text <&> \"quoted\""},
        {"min", std::numeric_limits<std::int64_t>::min()},
        {"umax", std::numeric_limits<std::uint64_t>::max()},
        {"ratio", 0.1},
        {"flag", true},
        {"blob", Bytes{0x00, 0x01, 0xfe, 0xff}},
        {"when", Date{1706707501.9}},
        {"list", Array{1, "two", Dictionary{{"three", 3.5}}}},
        {"alpha", Dictionary{}},
    };
    const auto xml = DataSerialize::getXMLInfo(Value(payload));
    ASSERT_TRUE(xml.has_value());
    EXPECT_EQ(xml->rfind("<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n", 0), 0u);
    const std::string open = "<plist version=\"1.0\">\n";
    ASSERT_NE(xml->find(open), std::string::npos);
    EXPECT_EQ(
        xml->substr(xml->find(open) + open.size()),
        "<dict>\n"
        "\t<key>zeta</key>\n\t<string>text &lt;&amp;&gt; \"quoted\"</string>\n"
        "\t<key>min</key>\n\t<integer>-9223372036854775808</integer>\n"
        "\t<key>umax</key>\n\t<integer>18446744073709551615</integer>\n"
        "\t<key>ratio</key>\n\t<real>0.10000000000000001</real>\n"
        "\t<key>flag</key>\n\t<true/>\n"
        "\t<key>blob</key>\n\t<data>\n\tAAH+/w==\n\t</data>\n"
        "\t<key>when</key>\n\t<date>2024-01-31T13:25:01Z</date>\n"
        "\t<key>list</key>\n\t<array>\n\t\t<integer>1</integer>\n\t\t<string>two</string>\n"
        "\t\t<dict>\n\t\t\t<key>three</key>\n\t\t\t<real>3.5</real>\n\t\t</dict>\n\t</array>\n"
        "\t<key>alpha</key>\n\t<dict/>\n"
        "</dict>\n</plist>\n");
    // The blob is the same text.
    const auto blob = DataSerialize::getPlistBlob(Value(payload));
    ASSERT_TRUE(blob.has_value());
    EXPECT_EQ(std::string(blob->begin(), blob->end()), *xml);
}

TEST(DataSerialize, WritesDatesToTheSecondAcrossTheFourDigitYears) {
    const auto dateText = [](double secondsSince1970) -> std::string {
        const auto xml = DataSerialize::getXMLInfo(Value(Date{secondsSince1970}));
        if (!xml)
            return "<none>";
        const auto begin = xml->find("<date>") + 6;
        return xml->substr(begin, xml->find("</date>") - begin);
    };
    const std::pair<double, std::string> cases[] = {
        {0, "1970-01-01T00:00:00Z"},
        {978307199.5, "2000-12-31T23:59:59Z"},
        {-5364662400, "1800-01-01T00:00:00Z"},  // beyond 32-bit seconds from 2001
        {253402300799, "9999-12-31T23:59:59Z"},
        {253402300800, "<none>"},  // year 10000
        {-30610224001, "<none>"},  // year 999
        {std::nan(""), "<none>"},
        {1e300, "<none>"},
    };
    for (const auto& [seconds, expected] : cases)
        EXPECT_EQ(dateText(seconds), expected) << seconds;
}

TEST(DataSerialize, GivesNothingForWhatIsNotAPropertyListAndChecksTextEncodings) {
    for (const Value& v : {Value(nullptr), Value(Dictionary{{"deep", Array{Value()}}}),
                           Value(std::string("nul\0inside", 10)),
                           Value(Dictionary{{std::string("key\0nul", 7), 1}})}) {
        EXPECT_EQ(DataSerialize::getPlistBlob(v), std::nullopt) << v.description();
        EXPECT_EQ(DataSerialize::getXMLInfo(v), std::nullopt);
        EXPECT_EQ(DataSerialize::getDataXMLInfo(v), std::nullopt);
        EXPECT_EQ(DataSerialize::getBase64XMLBlob(v), std::nullopt);
    }

    // The ASCII form refuses non-ASCII text; the UTF-8 form refuses only invalid UTF-8.
    const Value accented(Dictionary{{"name", "caf\xc3\xa9"}});
    const Value broken(Dictionary{{"name", "bad \xff byte"}});
    EXPECT_EQ(DataSerialize::getXMLInfo(accented), std::nullopt);
    EXPECT_NE(DataSerialize::getDataXMLInfo(accented).value_or("").find("caf\xc3\xa9"),
              std::string::npos);
    EXPECT_EQ(DataSerialize::getDataXMLInfo(broken), std::nullopt);
    EXPECT_EQ(DataSerialize::getDataXMLInfo(Value("\xed\xa0\x80")), std::nullopt);  // surrogate

    const auto base64 = DataSerialize::getBase64XMLBlob(accented).value_or("\n");
    EXPECT_EQ(base64.find_first_of("\r\n"), std::string::npos);
    EXPECT_EQ(QVReportingBase64Decode(base64), DataSerialize::getPlistBlob(accented));
}

TEST(Base64, EncodesTheStandardVectorsAndRefusesTextThatIsNotCanonical) {
    const std::pair<std::string, std::string> vectors[] = {
        {"", ""}, {"f", "Zg=="}, {"fo", "Zm8="}, {"foo", "Zm9v"}, {"\xfb\xff", "+/8="}};
    for (const auto& [plain, encoded] : vectors) {
        const Bytes bytes(plain.begin(), plain.end());
        EXPECT_EQ(QVReportingBase64Encode(bytes), encoded);
        EXPECT_EQ(QVReportingBase64Decode(encoded), bytes) << encoded;
    }
    for (const char* bad : {"Zg", "Zg=", "Zg==Zg==", "Z===", "Zh==", "Zm9v\n", "Zm9-", "=Zm9"})
        EXPECT_EQ(QVReportingBase64Decode(bad), std::nullopt) << bad;
}

}  // namespace
}  // namespace qv

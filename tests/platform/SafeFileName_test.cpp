#include "platform/SafeFileName.h"

#include <gtest/gtest.h>

#include <set>
#include <string>
#include <utility>

namespace qv {
namespace {

// Whether name could be taken for anything but one plain file in the current directory.
bool isPlainComponent(const std::string& name) {
    if (name.empty() || name == "." || name == ".." || name.front() == '.') {
        return false;
    }
    for (const char c : name) {
        const auto u = static_cast<unsigned char>(c);
        if (c == '/' || u < 0x20 || u == 0x7F) {
            return false;
        }
    }
    return true;
}

TEST(ASafeFileComponent, KeepsUTF8AndEscapesWhatCouldLeaveTheDirectoryOrIsNotText) {
    const std::pair<std::string, std::string> cases[] = {
        {"Café Ünïcode 音", "Café Ünïcode 音"},
        {"a.b..c", "a.b..c"},
        {"../../etc/x", "%2E.%2F..%2Fetc%2Fx"},
        {".", "%2E"},
        {"..", "%2E."},
        {".hidden", "%2Ehidden"},
        {"line\nfeed\r", "line%0Afeed%0D"},
        {std::string("nul\0byte", 8), "nul%00byte"},
        {"del\x7f", "del%7F"},
        {"", "%"},
        {"a\x80z", "a%80z"},                       // lone continuation byte
        {"\xE2\x82", "%E2%82"},                    // truncated sequence
        {"\xC0\xAF", "%C0%AF"},                    // overlong "/"
        {"\xED\xA0\x80", "%ED%A0%80"},             // surrogate
        {"\xF4\x90\x80\x80", "%F4%90%80%80"},      // beyond U+10FFFF
        {"\xF4\x8F\xBF\xBF", "\xF4\x8F\xBF\xBF"},  // the largest code point
    };
    std::set<std::string> names;
    for (const auto& [text, name] : cases) {
        EXPECT_EQ(QVReportingSafeFileComponent(text), name) << text;
        EXPECT_TRUE(isPlainComponent(QVReportingSafeFileComponent(text))) << text;
    }
    // Distinct texts, even ones that look like escapes, give distinct names.
    const std::string texts[] = {"a/b", "a_b", "a%2Fb", "a%b", "", "%", ".", "%2E", "x\n", "x%0A"};
    for (const auto& text : texts) {
        names.insert(QVReportingSafeFileComponent(text));
    }
    EXPECT_EQ(names.size(), std::size(texts));
}

TEST(ASafeFileComponent, BoundsLongTextsCuttingOnlyBetweenCharactersAndKeepsThemApart) {
    const std::string tenThousand(10000, 'a');
    const std::string result = QVReportingSafeFileComponent(tenThousand);
    ASSERT_EQ(result.size(), 128u);
    EXPECT_EQ(result.substr(0, 112), std::string(111, 'a') + "~");
    EXPECT_NE(QVReportingSafeFileComponent(tenThousand + "b"), result);
    EXPECT_EQ(QVReportingSafeFileComponent(std::string(128, 'a')), std::string(128, 'a'));
    EXPECT_EQ(QVReportingSafeFileComponent(std::string(129, 'a')).size(), 128u);
    EXPECT_TRUE(isPlainComponent(QVReportingSafeFileComponent(std::string(10000, '\n'))));

    // Two-byte, three-byte characters and three-byte escapes are dropped whole.
    EXPECT_EQ(QVReportingSafeFileComponent("ééé", 5), "éé");
    EXPECT_EQ(QVReportingSafeFileComponent("音音", 5), "音");
    EXPECT_EQ(QVReportingSafeFileComponent("ab/cd", 4), "ab");
    std::string text;
    for (int i = 0; i < 100; ++i) {
        text += "音";
    }
    const std::string cut = QVReportingSafeFileComponent(text, 40);  // with room for the hash
    ASSERT_LE(cut.size(), 40u);
    EXPECT_EQ(text.find(cut.substr(0, cut.find('~'))), 0u);
    EXPECT_EQ(cut.find('~') % 3, 0u);
    // A limit too small for the first character still names a file.
    EXPECT_EQ(QVReportingSafeFileComponent("音", 2), "%");
    EXPECT_EQ(QVReportingSafeFileComponent("abc", 0), "a");
}

}  // namespace
}  // namespace qv

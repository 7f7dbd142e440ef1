#include "platform/SafeFileName.h"

#include <gtest/gtest.h>

#include <set>
#include <string>

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

TEST(ASafeFileComponent, KeepsOrdinaryNamesAndUTF8AsTheyAre) {
    EXPECT_EQ(QVReportingSafeFileComponent("com.korvane.qvsound"), "com.korvane.qvsound");
    EXPECT_EQ(QVReportingSafeFileComponent("Café Ünïcode 音"), "Café Ünïcode 音");
    EXPECT_EQ(QVReportingSafeFileComponent("a.b..c"), "a.b..c");
}

TEST(ASafeFileComponent, NeverLeavesTheDirectoryWhateverTheText) {
    EXPECT_EQ(QVReportingSafeFileComponent("../../etc/x"), "%2E.%2F..%2Fetc%2Fx");
    EXPECT_EQ(QVReportingSafeFileComponent("/etc/passwd"), "%2Fetc%2Fpasswd");
    EXPECT_EQ(QVReportingSafeFileComponent("."), "%2E");
    EXPECT_EQ(QVReportingSafeFileComponent(".."), "%2E.");
    EXPECT_EQ(QVReportingSafeFileComponent(".hidden"), "%2Ehidden");
    EXPECT_EQ(QVReportingSafeFileComponent("line\nfeed\r"), "line%0Afeed%0D");
    EXPECT_EQ(QVReportingSafeFileComponent(std::string("nul\0byte", 8)), "nul%00byte");
    EXPECT_EQ(QVReportingSafeFileComponent("del\x7f"), "del%7F");
    EXPECT_EQ(QVReportingSafeFileComponent(""), "%");
    for (const std::string& text :
         {std::string("../../etc/x"), std::string("\n"), std::string(1, '\0'), std::string("."),
          std::string(".."), std::string(""), std::string("/"), std::string("a/../../b")}) {
        EXPECT_TRUE(isPlainComponent(QVReportingSafeFileComponent(text))) << text;
    }
}

TEST(ASafeFileComponent, EscapesBytesThatAreNotUTF8SoTheResultIsValidText) {
    // A lone continuation byte, a truncated sequence, an overlong "/", a surrogate, and a
    // sequence beyond U+10FFFF.
    EXPECT_EQ(QVReportingSafeFileComponent("a\x80z"), "a%80z");
    EXPECT_EQ(QVReportingSafeFileComponent("\xE2\x82"), "%E2%82");
    EXPECT_EQ(QVReportingSafeFileComponent("\xC0\xAF"), "%C0%AF");
    EXPECT_EQ(QVReportingSafeFileComponent("\xED\xA0\x80"), "%ED%A0%80");
    EXPECT_EQ(QVReportingSafeFileComponent("\xF4\x90\x80\x80"), "%F4%90%80%80");
    // The largest code point is kept.
    EXPECT_EQ(QVReportingSafeFileComponent("\xF4\x8F\xBF\xBF"), "\xF4\x8F\xBF\xBF");
}

TEST(ASafeFileComponent, GivesDistinctTextsDistinctNames) {
    const std::string texts[] = {"a/b", "a_b", "a%2Fb", "a%b", "",     "%", ".",
                                 "%2E", "..",  "%2E.",  "x\n", "x%0A", "_"};
    std::set<std::string> names;
    for (const auto& text : texts) {
        names.insert(QVReportingSafeFileComponent(text));
    }
    EXPECT_EQ(names.size(), std::size(texts));
}

TEST(ASafeFileComponent, BoundsLongTextsAndKeepsThemApart) {
    const std::string tenThousand(10000, 'a');
    const std::string result = QVReportingSafeFileComponent(tenThousand);
    ASSERT_EQ(result.size(), 128u);
    EXPECT_EQ(result.substr(0, 111), std::string(111, 'a'));
    EXPECT_EQ(result[111], '~');
    // Same beginning, different end: still two names.
    EXPECT_NE(QVReportingSafeFileComponent(tenThousand + "b"), result);
    // Exactly at the limit nothing is cut or added.
    EXPECT_EQ(QVReportingSafeFileComponent(std::string(128, 'a')), std::string(128, 'a'));
    EXPECT_EQ(QVReportingSafeFileComponent(std::string(129, 'a')).size(), 128u);
    // Ten thousand line feeds become escapes, then are cut like any other text.
    const std::string feeds = QVReportingSafeFileComponent(std::string(10000, '\n'));
    EXPECT_EQ(feeds.size(), 128u);
    EXPECT_TRUE(isPlainComponent(feeds));
}

TEST(ASafeFileComponent, CutsBetweenCharactersAndEscapesNeverInsideThem) {
    // "é" is two bytes: with a limit of 5 the third one cannot be split, so two fit.
    EXPECT_EQ(QVReportingSafeFileComponent("ééé", 5), "éé");
    // "音" is three bytes.
    EXPECT_EQ(QVReportingSafeFileComponent("音音", 5), "音");
    // An escape is three bytes and is dropped whole.
    EXPECT_EQ(QVReportingSafeFileComponent("ab/cd", 4), "ab");
    // With room for the hash the cut still lands on a character boundary.
    std::string text;
    for (int i = 0; i < 100; ++i) {
        text += "音";
    }
    const std::string cut = QVReportingSafeFileComponent(text, 40);
    ASSERT_LE(cut.size(), 40u);
    const std::string kept = cut.substr(0, cut.find('~'));
    EXPECT_EQ(kept.size() % 3, 0u);
    EXPECT_EQ(kept, text.substr(0, kept.size()));
    // A limit too small for the first character still names a file.
    EXPECT_EQ(QVReportingSafeFileComponent("音", 2), "%");
    EXPECT_EQ(QVReportingSafeFileComponent("abc", 0), "a");
}

}  // namespace
}  // namespace qv

#include "platform/SafeFileName.h"

#include <gtest/gtest.h>

#include <string>

namespace qv {
namespace {

// What each byte becomes, that no result leaves the directory or splits a character or an
// escape, and that results that fit read back to their text are the safe_file_name fuzz target's
// properties; here, the default limit and the hash that keeps long texts apart.
TEST(ASafeFileComponent, BoundsLongTextsToItsDefaultLimitAndKeepsThemApart) {
    const std::string tenThousand(10000, 'a');
    const std::string result = QVReportingSafeFileComponent(tenThousand);
    ASSERT_EQ(result.size(), 128u);
    EXPECT_EQ(result.substr(0, 112), std::string(111, 'a') + "~");
    EXPECT_NE(QVReportingSafeFileComponent(tenThousand + "b"), result);
    EXPECT_EQ(QVReportingSafeFileComponent(std::string(128, 'a')), std::string(128, 'a'));
    EXPECT_EQ(QVReportingSafeFileComponent(std::string(129, 'a')).size(), 128u);
}

}  // namespace
}  // namespace qv

#include "session/QVReportingVocabulary.h"

#include <gtest/gtest.h>

namespace qv {
namespace {

TEST(TheVocabulary, SpellsPrefixedCategoriesAndReadsBackOnlyBaseNamesCaseSensitively) {
    EXPECT_EQ(QVReportingUtilityCategoryString(0x80000005), "Toolbox_Output");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x00030008), "_Setup");  // unknown prefix
    EXPECT_EQ(QVReportingUtilityCategoryString(0xFFFFFFFE), "_Undefined");
    for (AudioEventCategory c = 1; c <= 16; ++c)
        EXPECT_EQ(QVReportingUtilityCategoryFromString(QVReportingUtilityCategoryString(c)), c);
    for (const char* notBase : {"Earlink", "DSP_Setup", "setup"})
        EXPECT_EQ(QVReportingUtilityCategoryFromString(notBase), 0xFFFFFFFFu) << notBase;
    for (AudioEventType t = 0; t <= 18; ++t)
        EXPECT_EQ(QVReportingUtilityTypeFromString(QVReportingUtilityTypeString(t)), t);
    for (AudioServiceType t = 0; t <= 13; ++t) {
        EXPECT_EQ(QVReportingUtilityGenerateServiceTypeFromServiceName(
                      QVReportingUtilityGenerateServiceNameFromServiceType(t)),
                  t);
    }
    EXPECT_EQ(QVReportingUtilityGenerateServiceTypeFromServiceName("Telephony"), 65535);
}

}  // namespace
}  // namespace qv

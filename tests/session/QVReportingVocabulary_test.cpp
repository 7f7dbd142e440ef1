#include "session/QVReportingVocabulary.h"

#include <gtest/gtest.h>

namespace qv {
namespace {

TEST(TheVocabulary, SpellsCategoriesWithPrefixesAndTheUnderscoreOfUnknownPrefixes) {
    EXPECT_EQ(QVReportingUtilityCategoryString(8), "Setup");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x10000008), "DSP_Setup");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x00030008), "_Setup");
    EXPECT_EQ(QVReportingUtilityCategoryString(0xFFFFFFFF), "Undefined");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x10000000), "DSP_Undefined");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x80000005), "Toolbox_Output");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x00010000), "_Undefined");
    EXPECT_EQ(QVReportingUtilityCategoryString(0x08000001), "Session_Generic");
    EXPECT_EQ(QVReportingUtilityCategoryString(17), "Earlink");
    EXPECT_EQ(QVReportingUtilityCategoryString(18), "Undefined");
    EXPECT_EQ(QVReportingUtilityCategoryString(0), "Undefined");
    EXPECT_EQ(QVReportingUtilityCategoryString(0xFFFFFFFE), "_Undefined");
}

TEST(TheVocabulary, ReadsBackOnlyTheBaseCategoriesOneToSixteen) {
    for (AudioEventCategory c = 1; c <= 16; ++c) {
        EXPECT_EQ(QVReportingUtilityCategoryFromString(QVReportingUtilityCategoryString(c)), c);
    }
    EXPECT_EQ(QVReportingUtilityCategoryFromString("Earlink"), 0xFFFFFFFFu);
    EXPECT_EQ(QVReportingUtilityCategoryFromString("DSP_Setup"), 0xFFFFFFFFu);
    EXPECT_EQ(QVReportingUtilityCategoryFromString("setup"), 0xFFFFFFFFu);
    EXPECT_EQ(QVReportingUtilityCategoryFromString("Unknown"), 0xFFFFFFFFu);
    EXPECT_EQ(QVReportingUtilityCategoryFromString(""), 0xFFFFFFFFu);
}

TEST(TheVocabulary, SpellsTypesAndReadsThemBackWithoutMemoryLog) {
    EXPECT_EQ(QVReportingUtilityTypeString(0), "Generic");
    EXPECT_EQ(QVReportingUtilityTypeString(20), "Generic");
    EXPECT_EQ(QVReportingUtilityTypeString(14), "Listeningenhancement");
    EXPECT_EQ(QVReportingUtilityTypeString(19), "MemoryLog");
    EXPECT_EQ(QVReportingUtilityTypeString(65535), "Unknown");
    for (AudioEventType t = 0; t <= 18; ++t) {
        EXPECT_EQ(QVReportingUtilityTypeFromString(QVReportingUtilityTypeString(t)), t);
    }
    EXPECT_EQ(QVReportingUtilityTypeFromString("MemoryLog"), 0);
    EXPECT_EQ(QVReportingUtilityTypeFromString("Unknown"), 65535);
    EXPECT_EQ(QVReportingUtilityTypeFromString("start"), 0);
}

TEST(TheVocabulary, NamesServiceTypesCaseSensitively) {
    EXPECT_EQ(QVReportingUtilityGenerateServiceNameFromServiceType(11), "test");
    EXPECT_EQ(QVReportingUtilityGenerateServiceNameFromServiceType(13), "systemsounds");
    EXPECT_EQ(QVReportingUtilityGenerateServiceNameFromServiceType(14), "unknown");
    EXPECT_EQ(QVReportingUtilityGenerateServiceNameFromServiceType(65535), "unknown");
    EXPECT_EQ(QVReportingUtilityGenerateServiceTypeFromServiceName("telephony"), 2);
    EXPECT_EQ(QVReportingUtilityGenerateServiceTypeFromServiceName("Telephony"), 65535);
    EXPECT_EQ(QVReportingUtilityGenerateServiceTypeFromServiceName("unknown"), 65535);
    for (AudioServiceType t = 0; t <= 13; ++t) {
        EXPECT_EQ(QVReportingUtilityGenerateServiceTypeFromServiceName(
                      QVReportingUtilityGenerateServiceNameFromServiceType(t)),
                  t);
    }
}

TEST(TheVocabulary, SeesABTestModeOnlyForPrefixedCategories) {
    EXPECT_FALSE(QVReportingUtilityIsABTestModeOn(0xFFFFFFFF));
    EXPECT_TRUE(QVReportingUtilityIsABTestModeOn(0x00010001));
    EXPECT_TRUE(QVReportingUtilityIsABTestModeOn(0xFFFFFFFE));
    EXPECT_FALSE(QVReportingUtilityIsABTestModeOn(0x0000FFFF));
    EXPECT_EQ(QVReportingUtilityExtractSessionIDFromReporterID(-5), -5);
}

}  // namespace
}  // namespace qv

#include "QVReportingExportCursor.h"

#include <gtest/gtest.h>

#include <fstream>

#include "QVReportingExportFiles.h"
#include "fakes/TempDirectory.h"

namespace qv::exporter {
namespace {

class QVReportingExportCursorTest : public ::testing::Test {
  protected:
    void write(const std::string& text) {
        std::filesystem::create_directories(path().parent_path());
        std::ofstream(path()) << text;
    }
    std::filesystem::path path() const { return QVReportingExportCursorPath(dir_); }

    test::TempDirectory tmp_{"qvexport-cursor"};
    const std::filesystem::path dir_ = tmp_.path();
};

TEST_F(QVReportingExportCursorTest, RoundTripsAndNeverGoesBack) {
    std::string error;
    auto cursor = QVReportingExportCursor::load(path(), error);
    EXPECT_EQ(error, "");
    EXPECT_TRUE(cursor.sinks().empty()) << "a missing file is an empty cursor";
    cursor.advance("analytics", 10);
    cursor.advance("analytics", 7);
    cursor.advance("mtx", 18446744073709551615ull);
    EXPECT_EQ(cursor.seq("analytics"), 10u);
    EXPECT_EQ(cursor.seq("convo"), 0u);
    ASSERT_EQ(cursor.save(path()), "");
    EXPECT_FALSE(std::filesystem::exists(path().string() + ".tmp"));
    EXPECT_EQ(QVReportingExportCursor::load(path(), error), cursor);
    EXPECT_EQ(error, "");
    EXPECT_EQ(cursor.toJson(), "{\"sinks\":{\"analytics\":10,\"mtx\":18446744073709551615}}\n");
}

TEST_F(QVReportingExportCursorTest, AFileThatIsNotACursorIsAnErrorNeverAnEmptyCursor) {
    for (const char* text :
         {"", "{", "[]", "{\"sinks\": 3}", "{\"sinks\": {\"a\": -1}}", "{\"sinks\": {\"a\": 1.5}}",
          "{\"sinks\": {\"a\": \"7\"}}", "{\"other\": {}}"}) {
        write(text);
        std::string error;
        const auto cursor = QVReportingExportCursor::load(path(), error);
        EXPECT_NE(error, "") << text;
        EXPECT_TRUE(cursor.sinks().empty()) << text;
    }
}

TEST_F(QVReportingExportCursorTest, ASaveIntoADirectoryThatCannotBeMadeSaysWhy) {
    std::ofstream(dir_ / "export") << "a file where the directory should be";
    QVReportingExportCursor cursor;
    cursor.advance("analytics", 1);
    EXPECT_NE(cursor.save(path()), "");
}

}  // namespace
}  // namespace qv::exporter

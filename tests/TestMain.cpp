#include <gtest/gtest.h>

#include "session/QVReportingLog.h"

int main(int argc, char** argv) {
    ::testing::InitGoogleTest(&argc, argv);
    // Tests that look at log lines install a memory sink of their own; the rest stay quiet.
    qv::setLogLevel(qv::LogLevel::Error);
    return RUN_ALL_TESTS();
}

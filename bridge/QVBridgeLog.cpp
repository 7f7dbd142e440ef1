#include "QVBridgeLog.h"

#include <atomic>
#include <cstdio>
#include <mutex>

namespace qv::bridge {

namespace {
std::atomic<QVBridgeLogLevel> gLevel{QVBridgeLogLevel::kInfo};
std::mutex gWriteMutex;
}  // namespace

void QVBridgeSetLogLevel(QVBridgeLogLevel level) {
    gLevel = level;
}

bool QVBridgeLogEnabled(QVBridgeLogLevel level) {
    return level >= gLevel.load();
}

void QVBridgeLogWrite(QVBridgeLogLevel level, std::string_view line) {
    const char* tag = level == QVBridgeLogLevel::kError  ? "error"
                      : level == QVBridgeLogLevel::kInfo ? "info"
                                                         : "debug";
    std::lock_guard lock(gWriteMutex);
    std::fprintf(stderr, "qvreport-pipewire %s: %.*s\n", tag, static_cast<int>(line.size()),
                 line.data());
    std::fflush(stderr);
}

}  // namespace qv::bridge

// The bridge's log: one line per event on standard error (the journal, under systemd), with a
// level below which lines cost nothing. Thread-safe; lines are never interleaved.
#pragma once

#include <string_view>

#include <fmt/format.h>

namespace qv::bridge {

enum class QVBridgeLogLevel { kDebug, kInfo, kError };

void QVBridgeSetLogLevel(QVBridgeLogLevel level);
bool QVBridgeLogEnabled(QVBridgeLogLevel level);
void QVBridgeLogWrite(QVBridgeLogLevel level, std::string_view line);

template <typename... Args>
void QVBridgeLog(QVBridgeLogLevel level, fmt::format_string<Args...> format, Args&&... args) {
    if (QVBridgeLogEnabled(level)) {
        QVBridgeLogWrite(level, fmt::format(format, std::forward<Args>(args)...));
    }
}

}  // namespace qv::bridge

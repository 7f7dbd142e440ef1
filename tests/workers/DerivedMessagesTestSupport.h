// Builders and readers shared by the tests of the derived-message workers.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"

namespace qv::test {

using Messages = std::vector<std::shared_ptr<QVReportingSessionMessage>>;

// A client message at time t ("qvreporting_timestamp"; none when t is null).
inline std::shared_ptr<QVReportingSessionMessage> at(Value t, Dictionary payload) {
    if (!t.isNull()) {
        payload.set("qvreporting_timestamp", t);
    }
    return QVReportingSessionMessage::initWithMessage(payload, category::kPlayback, type::kGeneric);
}
inline std::shared_ptr<QVReportingSessionMessage> set(Value t, const char* key, Value v) {
    return at(t, {{key, v}});
}

// A session whose previousValues are previous, for a worker to derive from.
inline std::shared_ptr<QVReportingSession> sessionWith(const Platform& platform,
                                                       const Dictionary& previous) {
    auto session = QVReportingSession::initWithID(platform, 7, {1});
    session->previousValues() = previous;
    return session;
}

inline std::vector<Dictionary::Entry> entriesOf(const QVReportingSessionMessage& message) {
    return {message.message().begin(), message.message().end()};
}

// The debug lines of the session category that mention func, without the "file:line " prefix.
inline std::vector<std::string> derivationLines(const MemoryLogSink& sink, std::string_view func) {
    std::vector<std::string> lines;
    for (const auto& line : sink.lines()) {
        if (line.text.find(func) != std::string::npos && line.level == LogLevel::Debug &&
            line.category == "qvrr") {
            lines.push_back(line.text.substr(line.text.find(':') + 7));
        }
    }
    return lines;
}

}  // namespace qv::test

// Builders shared by the tests of the derived-message workers.
#pragma once

#include <memory>
#include <vector>

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

inline std::shared_ptr<QVReportingSession> sessionWith(const Platform& platform,
                                                       const Dictionary& previous) {
    auto session = QVReportingSession::initWithID(platform, 7, {1});
    session->previousValues() = previous;
    return session;
}

}  // namespace qv::test

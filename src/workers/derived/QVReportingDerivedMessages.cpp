#include "workers/derived/QVReportingDerivedMessages.h"

#include <cmath>

#include "session/QVReportingLog.h"
#include "session/QVReportingSession.h"

namespace qv {

std::optional<double> QVReportingDerivedTimeValue(const Value* value) {
    if (value == nullptr) {
        return std::nullopt;
    }
    switch (value->kind()) {
        case Value::Kind::Int:
        case Value::Kind::UInt:
        case Value::Kind::Double: {
            const double t = value->doubleValue();
            return std::isnan(t) ? std::nullopt : std::optional<double>(t);
        }
        default:
            return std::nullopt;
    }
}

void QVReportingSendDerivedMessages(QVReportingSession& session, std::string_view what,
                                    const QVReportingMessageList& derived) {
    if (derived.empty()) {
        return;
    }
    QVLOG_DEFAULT(QVReportingSessionCategory(), "sending {} for reporter {}", what,
                  session.reporterID());
    // Sending stores each message in the session's list: derived is a list of its own.
    for (const auto& message : derived) {
        session.sendMessage(message);
    }
}

}  // namespace qv

// What the workers that derive messages at stop share: how they read payload values, and how
// they hand what they derived back to their session.
//
// Thread safety: called on the session's queue, like the workers.
#pragma once

#include <memory>
#include <optional>
#include <string_view>
#include <vector>

#include "values/Value.h"

namespace qv {

class QVReportingSession;
class QVReportingSessionMessage;

using QVReportingMessageList = std::vector<std::shared_ptr<QVReportingSessionMessage>>;

// The time a value holds, by the session's own rule: an integer or a double that is not NaN.
// Anything else (a string, a boolean, no value) is no time at all.
std::optional<double> QVReportingDerivedTimeValue(const Value* value);

// Sends each derived message, in order, into the session, after the default-level line
// "sending <what> for reporter <ID>"; nothing, not even the line, when there is none.
void QVReportingSendDerivedMessages(QVReportingSession& session, std::string_view what,
                                    const QVReportingMessageList& derived);

}  // namespace qv

// Numbers read out of payload and settings values the way the daemon reads them everywhere: a
// number is taken as it is, a bool as 0 or 1, text by its leading number ("1024 frames" is 1024,
// "  -3" is -3, "abc" is 0), and anything else (null, bytes, dates, arrays, dictionaries, an
// absent value) as 0. Out-of-range values are clamped to the result's range, never wrapped, and
// a NaN reads as 0 wherever the result is an integer.
//
// Thread safety: pure functions.
#pragma once

#include <cstdint>

namespace qv {

class Value;

// As a signed 64-bit integer; doubles are truncated toward zero.
std::int64_t QVReportingIntegerValue(const Value* value);
// As a signed 32-bit integer: QVReportingIntegerValue clamped to 32 bits.
std::int32_t QVReportingIntValue(const Value* value);
// As a double; text by its leading decimal number ("2.5e3x" is 2500). Numbers, NaN and the
// infinities included, are returned unchanged; text that overflows reads as an infinity.
double QVReportingDoubleValue(const Value* value);

}  // namespace qv

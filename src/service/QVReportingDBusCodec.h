// Payload values to and from D-Bus messages, straight through sd-bus's message API: no
// intermediate variant objects on the way in or out.
//
// Reading: b is a bool; y n q i u x signed integers; t an unsigned integer; d a double; s o g
// strings; ay bytes; other arrays and structs arrays; a{s?} dictionaries (a dictionary with keys
// of another type becomes an array of [key, value] pairs); variants unwrap. A unix fd, or input
// beyond the limits, is refused with a reason naming the key. The limits measure what the payload
// will hold: each value counts (a pair too, a variant's wrapping not), and each level of nesting
// (a pair's too), so that a payload read back from the daemon's own writing fits them as well.
// A string sd-bus will not read (it refuses Unicode noncharacters, which D-Bus allows) makes the
// reader take the call's bytes and read them itself (QVReportingDBusWireReader), with the same
// result, or the same refusal with the key named; the call's other arguments then come with the
// result, as the message can no longer be read on.
// Writing: dates go out as doubles. The append functions return sd-bus's negative errno on
// failure (a string sd-bus will not write), and the message is then unusable.
//
// Thread safety: the functions keep no state (but for the private connection a thread that needed
// one keeps for the next time); a message must only be touched by one thread.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <type_traits>
#include <vector>

#include "service/QVReportingError.h"
#include "service/QVReportingPayloadMeter.h"
#include "session/QVReportingStats.h"
#include "values/Value.h"

typedef struct sd_bus_message sd_bus_message;

namespace qv {

struct QVReportingDecodeResult {
    Dictionary dictionary;
    // The arguments after the dictionary, when they were read with it from the call's bytes;
    // otherwise they are still in the message.
    std::optional<Array> rest;
    // Set when the input was refused; the limit (when it was one) is in limit.
    std::optional<QVReportingError> error;
    std::optional<QVReportingStats::Limit> limit;
    // What the input cost against the budget's bytes (about its size on the wire).
    std::size_t bytes = 0;
};

// Reads an a{sv} at the message's current position.
QVReportingDecodeResult QVReportingReadDictionary(sd_bus_message* message,
                                                  const QVReportingInputBudget& budget);

// The arguments after the dictionary (SetConfiguration's, SendMessage's): from decoded.rest when
// it holds them, from the message otherwise. False when the message does not hold them.
bool QVReportingReadRest(sd_bus_message* message, const QVReportingDecodeResult& decoded,
                         std::int64_t& reporterID);
bool QVReportingReadRest(sd_bus_message* message, const QVReportingDecodeResult& decoded,
                         std::uint32_t& category, std::uint16_t& type,
                         std::vector<std::int64_t>& reporterIDs);

// Appends a value as a variant.
int QVReportingAppendVariant(sd_bus_message* message, const Value& value);
// Appends an a{sv}.
int QVReportingAppendDictionary(sd_bus_message* message, const Dictionary& dictionary);

// A fixed-size D-Bus value as a payload value: the unsigned integers narrower than 64 bits (y, q,
// u) widen to signed 64-bit; the others keep their type.
template <typename T>
Value QVReportingDBusScalarValue(T v) {
    if constexpr (std::is_same_v<T, std::uint8_t> || std::is_same_v<T, std::uint16_t> ||
                  std::is_same_v<T, std::uint32_t>) {
        return Value(std::int64_t{v});
    } else {
        return Value(v);
    }
}

}  // namespace qv

// D-Bus messages read from their bytes, for the calls sd-bus will not read: its string check
// refuses Unicode noncharacters (U+FFFF, U+FDD0..U+FDEF, ...), which D-Bus allows and clients
// send, and a message it has refused once cannot be read on.
//
// The body is read as QVReportingReadDictionary reads it through sd-bus: the same types, the same
// values, the same limits charged in the same order, the same refusals. Strings must be UTF-8
// (no overlong forms, no surrogates, nothing past U+10FFFF) without NUL bytes; noncharacters are
// taken like any other character. Object paths and signatures are checked as D-Bus defines them,
// and containers may nest 64 deep (variants included), as on the bus. Either endianness.
//
// Thread safety: no state; the bytes must not change while they are read.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>

#include "service/QVReportingDBusCodec.h"

namespace qv {

class QVReportingDBusWireReader {
  public:
    // A whole message as it travels: what its header says of the body, and the body.
    struct Message {
        bool bigEndian = false;
        std::string signature;
        std::span<const std::uint8_t> body;
    };

    // The message at the start of bytes (which may go on past it); nothing when they do not
    // start with a well-formed header, or end before the body does.
    static std::optional<Message> split(std::span<const std::uint8_t> bytes);

    // A call's arguments: the first must be an a{sv}, read under the budget into dictionary;
    // those after it go into rest, unbudgeted (the caller checks them).
    static QVReportingDecodeResult readArguments(const Message& message,
                                                 const QVReportingInputBudget& budget);
};

}  // namespace qv

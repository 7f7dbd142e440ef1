// The sd_bus_message under an sdbus-c++ message: the daemon's readers and writers take sd-bus's
// own, and tests build theirs with sdbus-c++. sdbus-c++ keeps it protected: a pointer to the
// member, taken in a derived class, reads it.
#pragma once

#include <sdbus-c++/Message.h>

typedef struct sd_bus_message sd_bus_message;

// Exported by libsdbus-c++ 1.2 but declared in its public headers only by later versions: a
// message that belongs to no bus.
namespace sdbus {
PlainMessage createPlainMessage();
}

namespace qv {

struct RawMessage : sdbus::Message {
    static sd_bus_message* of(const sdbus::Message& message) {
        return static_cast<sd_bus_message*>(message.*(&RawMessage::msg_));
    }
};

}  // namespace qv

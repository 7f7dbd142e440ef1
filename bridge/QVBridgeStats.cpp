#include "QVBridgeStats.h"

#include <fmt/format.h>

namespace qv::bridge {

std::string QVBridgeStats::summary() const {
    return fmt::format(
        "messages_sent={} messages_undelivered={} events_dropped={} daemon_reconnects={} "
        "pipewire_reconnects={}",
        messagesSent(), messagesUndelivered(), eventsDropped(), daemonReconnects(),
        pipewireReconnects());
}

}  // namespace qv::bridge

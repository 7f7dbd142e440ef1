// The bridge's guardrail counters: every event it had no room for and every message that did not
// reach the daemon is counted here, never dropped silently. Thread-safe.
#pragma once

#include <atomic>
#include <cstdint>
#include <string>

namespace qv::bridge {

class QVBridgeStats {
  public:
    // An event found the queue full (the daemon is slow or stalled).
    void noteEventDropped() { eventsDropped_.fetch_add(1, std::memory_order_relaxed); }
    // A message that could not be delivered: the daemon was away or refused the call.
    void noteMessageUndelivered() { messagesUndelivered_.fetch_add(1, std::memory_order_relaxed); }
    void noteMessageSent() { messagesSent_.fetch_add(1, std::memory_order_relaxed); }
    // The daemon's sessions were made again (a daemon that restarted or came back).
    void noteDaemonReconnect() { daemonReconnects_.fetch_add(1, std::memory_order_relaxed); }
    void notePipeWireReconnect() { pipewireReconnects_.fetch_add(1, std::memory_order_relaxed); }

    std::uint64_t eventsDropped() const { return eventsDropped_.load(); }
    std::uint64_t messagesUndelivered() const { return messagesUndelivered_.load(); }
    std::uint64_t messagesSent() const { return messagesSent_.load(); }
    std::uint64_t daemonReconnects() const { return daemonReconnects_.load(); }
    std::uint64_t pipewireReconnects() const { return pipewireReconnects_.load(); }

    // "messages_sent=.. messages_undelivered=.. events_dropped=.. ..." for the log.
    std::string summary() const;

  private:
    std::atomic<std::uint64_t> eventsDropped_{0};
    std::atomic<std::uint64_t> messagesUndelivered_{0};
    std::atomic<std::uint64_t> messagesSent_{0};
    std::atomic<std::uint64_t> daemonReconnects_{0};
    std::atomic<std::uint64_t> pipewireReconnects_{0};
};

}  // namespace qv::bridge

// A message's bytes exactly as they travel, which sd-bus keeps to itself: the message is sent
// again over a private connection (one end of a socketpair, the other end read here). A sealed
// message goes out as it is, byte for byte, so a received call comes back as its client wrote it.
// For the calls sd-bus refuses to read (QVReportingDBusCodec); the connection is made on first
// use.
//
// Thread safety: none. One instance per thread, forThisThread(); a message must not be touched by
// another thread meanwhile.
#pragma once

#include <cstdint>
#include <optional>
#include <vector>

typedef struct sd_bus sd_bus;
typedef struct sd_bus_message sd_bus_message;

namespace qv {

class QVReportingDBusMessageBytes {
  public:
    QVReportingDBusMessageBytes() = default;
    ~QVReportingDBusMessageBytes();
    QVReportingDBusMessageBytes(const QVReportingDBusMessageBytes&) = delete;
    QVReportingDBusMessageBytes& operator=(const QVReportingDBusMessageBytes&) = delete;

    static QVReportingDBusMessageBytes& forThisThread();

    // The sealed message's bytes; nothing when it cannot go over the connection (it carries unix
    // fds, say) or the connection fails (it is made again on the next call).
    std::optional<std::vector<std::uint8_t>> of(sd_bus_message* message);

  private:
    bool connect();
    void disconnect();
    // Moves the bus's queued output on and reads what reached the peer, for at most the time
    // left; false once the connection has failed or the time is up.
    bool pump(std::vector<std::uint8_t>& into, std::size_t want, std::uint64_t deadlineMicros);

    sd_bus* bus_ = nullptr;
    int peer_ = -1;  // the other end of the bus's socket
};

}  // namespace qv

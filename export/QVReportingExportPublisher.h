// The exporter's side of NATS JetStream (libnats): one connection to the servers of --nats-url,
// kept up by the library (reconnects with back-off, forever), the stream made when missing, and
// asynchronous publishing with a message ID per line, each acknowledgement or failure handed to
// the callbacks.
//
// Subject "qvreporting.DEVICE.SINK", header "Nats-Msg-Id: DEVICE.SINK.SEQ": a line sent twice
// is stored once within the stream's duplicate window.
//
// Acknowledgements are waited for without a time-out here: the caller decides when one is late
// and abandons what is pending.
//
// Thread safety: start(), ensureStream(), publish(), abandonPending() and drain() are called from
// one thread. The callbacks run on the library's threads, never inside publish(), and never after
// the destructor, which closes the library and waits for its threads: one publisher per process.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <string_view>

#include "QVReportingExportConnection.h"

namespace qv::exporter {

class QVReportingExportPublisher {
  public:
    struct Callbacks {
        // The stream stored seq as its message streamSeq (duplicate: it held it already).
        std::function<void(std::string_view sink, std::uint64_t seq, std::uint64_t streamSeq,
                           bool duplicate)>
            acknowledged;
        // Publishing seq failed (server error, time-out, connection lost).
        std::function<void(std::string_view sink, std::uint64_t seq, const std::string& error)>
            failed;
        // The connection went up or down.
        std::function<void(bool connected)> connection;
    };

    QVReportingExportPublisher(QVReportingExportServerSettings settings, std::string device,
                               Callbacks callbacks);
    ~QVReportingExportPublisher();
    QVReportingExportPublisher(const QVReportingExportPublisher&) = delete;
    QVReportingExportPublisher& operator=(const QVReportingExportPublisher&) = delete;

    // Sets the connection up; servers that cannot be reached now are retried in the background.
    // An empty string, or what is wrong with the settings.
    std::string start();
    bool connected() const;
    // Makes the stream when it is missing (subjects "qvreporting.>", file storage, the replicas
    // and duplicate window asked for). An empty string, or why it could not be done now. With
    // unsettled, also says what the stream still lacks before it is written to (a leader, a
    // replica that is current): empty once it has settled.
    std::string ensureStream(std::string* unsettled = nullptr);
    // Publishes one line asynchronously. An empty string, or why the library refused it at once
    // (then no callback comes for it).
    std::string publish(std::string_view sink, std::uint64_t seq, std::string_view text);
    // Drops every publish still waiting for its acknowledgement: no callback comes for those any
    // more (an acknowledgement on its way is discarded). Returns how many.
    std::size_t abandonPending();
    // Waits up to timeout for the acknowledgements in flight.
    void drain(std::chrono::milliseconds timeout);

    static std::string subject(std::string_view device, std::string_view sink);
    static std::string messageID(std::string_view device, std::string_view sink, std::uint64_t seq);

  private:
    struct Library;
    std::unique_ptr<Library> nats_;
    QVReportingExportServerSettings settings_;
    std::string device_;
    Callbacks callbacks_;
    // "DEVICE.SINK." of each sink published to, the message ID's prefix (publishing thread only).
    std::map<std::string, std::string, std::less<>> idPrefixes_;
};

}  // namespace qv::exporter

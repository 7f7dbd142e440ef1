// One sink's lines between its cursor and the last line read: what is waiting to be published,
// what is in flight, and what the stream has acknowledged. The cursor moves only past lines
// acknowledged in seq order: an acknowledgement of seq 10 before that of seq 9 leaves it at 8.
//
// A failed publish (an error from the server, or no acknowledgement in time) stops the sink's
// sending until every other line in flight has settled; then everything not acknowledged is sent
// again from the oldest, so the stream receives the sink's lines in seq order again. What it
// already holds it refuses as a duplicate by message ID.
//
// Lines missing between two lines read (their segment expired before it was read) are counted
// as expired; the cursor passes them once everything before them is acknowledged.
//
// Thread safety: none; the exporter guards each window with its lock.
#pragma once

#include <cstddef>
#include <cstdint>
#include <deque>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace qv::exporter {

class QVReportingExportWindow {
  public:
    // A line to publish. The text stays where it is while the line is in flight (a line leaves
    // the window only once acknowledged, and other lines coming and going do not move it), so
    // it is read without the window's lock by the thread that took it.
    struct Outgoing {
        std::uint64_t seq = 0;
        std::string_view text;
        bool retry = false;  // it was sent before and failed
    };

    explicit QVReportingExportWindow(std::uint64_t cursor) : cursor_(cursor), last_(cursor) {}

    // Takes the next line read. Returns how many lines are missing between it and the line read
    // before (expired before they were read). A line at or below the last one is ignored.
    std::uint64_t add(std::uint64_t seq, std::string text, double time);

    // Up to limit lines to publish now, in seq order, marked in flight and sent at now (any
    // steady clock, in seconds). None while a failure is settling.
    std::vector<Outgoing> take(std::size_t limit, double now = 0);

    // The stream acknowledged seq. False for a line that was not in flight (already
    // acknowledged, or never sent from this window).
    bool acknowledge(std::uint64_t seq);
    // Publishing seq failed; the window settles and sends again from the oldest line not
    // acknowledged. False for a line that was not in flight.
    bool fail(std::uint64_t seq);
    // Every line in flight failed at once (the publisher dropped what it was waiting for).
    // Returns how many.
    std::size_t failAll();
    // When the longest-waiting line in flight was sent (the now of its take()).
    std::optional<double> oldestSentAt() const;

    // The seq up to which every line is acknowledged or expired.
    std::uint64_t cursor() const { return cursor_; }
    // The seq of the last line taken in.
    std::uint64_t last() const { return last_; }
    // Lines held: waiting, in flight, or acknowledged ahead of an older one.
    std::size_t size() const { return lines_.size(); }
    std::size_t inFlight() const { return inFlight_; }
    bool settling() const { return settling_; }
    // The "time" of the oldest line not acknowledged.
    std::optional<double> oldestTime() const;

  private:
    enum class State { Waiting, InFlight, Acknowledged };
    struct Line {
        std::uint64_t seq;
        std::string text;
        double time;
        State state;
        bool sent;
        double sentAt;
    };

    Line* find(std::uint64_t seq);
    // Drops acknowledged lines from the front, moving the cursor.
    void advance();
    // After a failure, once nothing is in flight: send again from the front.
    void rewindWhenSettled();

    std::deque<Line> lines_;  // in seq order; the front is never acknowledged
    std::size_t next_ = 0;    // index of the first line that may still be waiting
    std::size_t inFlight_ = 0;
    bool settling_ = false;
    std::uint64_t cursor_;
    std::uint64_t last_;
};

}  // namespace qv::exporter

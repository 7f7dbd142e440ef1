// The exporter's cursor: for each sink, the seq up to which every line is in the stream (or was
// expired before it could be sent). It is all the exporter keeps: the sink files are the buffer,
// and a restart resends from here, the stream refusing what it already holds by message ID.
//
// export/cursor.json: {"sinks": {"analytics": 1234, "mtx": 17}}
//
// Thread safety: a value type; one thread at a time.
#pragma once

#include <cstdint>
#include <filesystem>
#include <map>
#include <string>
#include <string_view>

namespace qv::exporter {

class QVReportingExportCursor {
  public:
    // The cursor in path; a missing file is an empty cursor. A file that cannot be read or is
    // not a cursor fills error and gives an empty cursor: the caller must not then write over
    // it, since starting from nothing would resend every line still on disk.
    static QVReportingExportCursor load(const std::filesystem::path& path, std::string& error);

    // The seq of a sink's last line in the stream; 0 for a sink not seen yet.
    std::uint64_t seq(std::string_view sink) const;
    // Moves a sink's cursor; it never goes back.
    void advance(const std::string& sink, std::uint64_t seq);
    const std::map<std::string, std::uint64_t, std::less<>>& sinks() const { return sinks_; }

    std::string toJson() const;
    // Writes the file atomically; an empty string, or what went wrong.
    std::string save(const std::filesystem::path& path) const;

    bool operator==(const QVReportingExportCursor&) const = default;

  private:
    std::map<std::string, std::uint64_t, std::less<>> sinks_;
};

}  // namespace qv::exporter

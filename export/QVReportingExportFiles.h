// The exporter's own files under the state directory: where they are, and how they are replaced.
//
// Thread safety: the free functions may be called from any thread; two writers of one path must
// not run at once (each file has a single writer, the exporter's main thread).
#pragma once

#include <filesystem>
#include <functional>
#include <string>
#include <string_view>

namespace qv::exporter {

using QVReportingExportEnvironment = std::function<const char*(const char* name)>;

// The daemon's rule for its state directory: $STATE_DIRECTORY (the first of its ':'-separated
// list), else /var/lib/qvreportd for root, else $XDG_STATE_HOME/qvreportd, else
// $HOME/.local/state/qvreportd.
std::string QVReportingExportDefaultStateDirectory(const QVReportingExportEnvironment& environment,
                                                   unsigned effectiveUserID);
std::string QVReportingExportDefaultStateDirectory();

// <stateDir>/export, the only directory the exporter writes to.
std::filesystem::path QVReportingExportDirectory(const std::filesystem::path& stateDir);
std::filesystem::path QVReportingExportCursorPath(const std::filesystem::path& stateDir);
std::filesystem::path QVReportingExportStatusPath(const std::filesystem::path& stateDir);

// Replaces path with text atomically: a temporary file beside it, fsync, rename, fsync of the
// directory (created when missing). Returns an empty string, or what went wrong.
std::string QVReportingExportWriteFileAtomically(const std::filesystem::path& path,
                                                 std::string_view text);

}  // namespace qv::exporter

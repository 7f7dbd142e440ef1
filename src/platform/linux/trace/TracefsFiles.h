// The files a trace recording works with: tracefs and its control files, and the /proc files
// that tell whether the process that made an instance still runs.
//
// Thread safety: pure functions over the files they are given.
#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <string_view>

namespace qv::tracefs {

// Instances this daemon makes are named "<kInstancePrefix><pid>-<n>".
constexpr std::string_view kInstancePrefix = "qvreportd-";

// Whether path is a mounted tracefs.
bool isTracefs(const std::filesystem::path& path);
// 0, or the errno of writing text to a tracefs control file.
int writeControl(const std::filesystem::path& path, std::string_view text);
// The first line of a small file; empty when it cannot be read.
std::string readSmall(const std::filesystem::path& path);
// The wall-clock second at which process pid started, or nothing when it does not exist.
std::optional<double> processStartTime(long pid);
// The process number in "qvreportd-<pid>-<n>", or nothing.
std::optional<long> instanceOwner(std::string_view name);

}  // namespace qv::tracefs

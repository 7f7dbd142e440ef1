// Reads a property-list file in the XML format (version 1.0) into payload values: dictionaries,
// arrays, strings, booleans, integers, reals, dates (seconds since 1970) and data. The trace
// worker reads its client's probe list with it.
//
// The path comes from a client, so the file is read with care: only a regular file (a FIFO or a
// device named here is refused without blocking), at most kMaxBytes, nested at most kMaxDepth
// deep (checked on the text before the parser sees it).
//
// Thread safety: pure function.
#pragma once

#include <cstddef>
#include <filesystem>
#include <optional>
#include <string>

#include "values/Value.h"

namespace qv {

struct QVReportingPropertyList {
    static constexpr std::size_t kMaxBytes = 4 * 1024 * 1024;
    static constexpr std::size_t kMaxDepth = 64;

    std::optional<Value> root;  // nothing on failure
    std::string error;          // why, when root is nothing
};

QVReportingPropertyList QVReportingReadXMLPropertyListFile(const std::filesystem::path& path);
// The same for text in memory.
QVReportingPropertyList QVReportingReadXMLPropertyList(const std::string& xml);

}  // namespace qv

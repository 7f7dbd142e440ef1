// Whole reads of small files that a user or another program puts in place (the device file,
// accessory files): the file must be a regular file of bounded size, opened without following a
// link and without blocking, so that a pipe, a device such as /dev/zero, a directory or a link
// in its place is refused with a reason instead of hanging, exhausting or aborting the reader.
//
// Thread safety: pure functions over the file system.
#pragma once

#include <cstddef>
#include <string>

namespace qv {

struct RegularFileRead {
    enum class Status { Read, Missing, Refused };
    Status status = Status::Missing;
    std::string text;    // the whole file when Read
    std::string reason;  // why, when Refused: "it is a FIFO, not a regular file", ...
};

// Reads path whole. Missing: no such file. Refused: a link, not a regular file, more than
// maxBytes (also when it grows past them while being read), or unreadable.
RegularFileRead QVReportingReadRegularFile(const std::string& path, std::size_t maxBytes);

// What a file of this st_mode is, for a log line: "a FIFO", "a directory", "a symbolic link"...
const char* QVReportingFileKind(unsigned mode);

}  // namespace qv

// Whole writes to file descriptors, past short writes and signals, and closing what was written.
//
// Thread safety: pure functions over the descriptor they are given.
#pragma once

#include <string_view>

namespace qv {

// Writes all of data to fd; false, with errno set, when the file refuses.
bool writeAll(int fd, std::string_view data);

// Closes a file that was written: flushed to disk first (before the caller renames it into
// place) unless writing it already failed. Returns the first errno of error (what writing it
// met, 0 for none), the flush and the close; 0 when all went well.
int syncAndClose(int fd, int error);

}  // namespace qv

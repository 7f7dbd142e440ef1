// Whole writes to file descriptors, past short writes and signals.
//
// Thread safety: pure functions over the descriptor they are given.
#pragma once

#include <string_view>

namespace qv {

// Writes all of data to fd; false, with errno set, when the file refuses.
bool writeAll(int fd, std::string_view data);

}  // namespace qv

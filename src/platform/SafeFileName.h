// File names made from strings that clients or users chose (suite names, application names):
// whatever the text, the result names one plain file inside the directory it is put in.
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace qv {

// One safe path component for text:
// - bytes that could leave the directory or confuse a reader are written as "%XX" (upper-case
//   hex): "/", "%" itself, NUL and the other control characters, DEL, bytes that are not part of
//   valid UTF-8, and a leading "." (so neither "." nor ".." nor a hidden file can result);
// - every other byte, valid UTF-8 included, is kept, so the result stays readable;
// - distinct texts give distinct results as long as they fit; a result longer than maxLength
//   bytes is cut on a character boundary and, when maxLength leaves room (more than 17 bytes),
//   ends in "~" and 16 hex digits of a hash of the whole text, so long texts that share a
//   beginning still differ;
// - empty text gives "%", which no other text gives (short limits aside).
// The result is never empty and never longer than maxLength bytes (maxLength is at least 1).
std::string QVReportingSafeFileComponent(std::string_view text, std::size_t maxLength = 128);

}  // namespace qv

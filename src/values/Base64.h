// Base64 text of byte buffers, in the standard alphabet of RFC 4648 ("A-Z a-z 0-9 + /") with
// "=" padding and no line breaks: the form sink files and property-list helpers write.
//
// Thread safety: pure functions.
#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv {

std::string QVReportingBase64Encode(const Bytes& bytes);

// The bytes of canonical base64 text, as QVReportingBase64Encode writes it; nothing when the
// text is not: a length that is not a multiple of 4, a character outside the alphabet, padding
// anywhere but the end, or nonzero bits in the last character before the padding (which would
// let two texts decode to the same bytes). Whitespace is not skipped.
std::optional<Bytes> QVReportingBase64Decode(std::string_view text);

}  // namespace qv

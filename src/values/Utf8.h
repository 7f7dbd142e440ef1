// Well-formed UTF-8, as the bus, JSON writers and property lists demand it: no overlong forms,
// no surrogates, nothing above U+10FFFF.
//
// Thread safety: pure functions.
#pragma once

#include <cstddef>
#include <string_view>

namespace qv {

// Length of the well-formed sequence that starts at text[i] (1 for ASCII), or 0 when there is
// none. REQUIRES: i < text.size().
std::size_t QVReportingUtf8SequenceLength(std::string_view text, std::size_t i);

bool QVReportingIsValidUtf8(std::string_view text);

}  // namespace qv

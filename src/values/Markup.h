// Text made safe to put in HTML or in the simple markup notification bodies may be read as.
//
// Thread safety: pure function.
#pragma once

#include <string>
#include <string_view>

namespace qv {

// &, <, > and " as entities; everything else as it is.
std::string QVReportingEscapeMarkup(std::string_view text);

}  // namespace qv

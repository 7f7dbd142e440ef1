// What an errno value means, for log lines and error texts.
#pragma once

#include <string>
#include <system_error>

namespace qv {

// Thread-safe where strerror() is not: the platform services call it from their own threads.
inline std::string errnoText(int error) {
    return std::error_code(error, std::generic_category()).message();
}

}  // namespace qv

#include "platform/SafeFileName.h"

#include <algorithm>
#include <cstdint>
#include <vector>

#include "values/Utf8.h"

namespace qv {

namespace {

constexpr char kHex[] = "0123456789ABCDEF";
// "~" and 16 hex digits mark a cut result.
constexpr std::size_t kHashSuffixLength = 17;

std::string escaped(unsigned char c) {
    return {'%', kHex[c >> 4], kHex[c & 0x0F]};
}

std::uint64_t fnv1a(std::string_view text) {
    std::uint64_t hash = 14695981039346656037ULL;
    for (const char c : text) {
        hash ^= static_cast<unsigned char>(c);
        hash *= 1099511628211ULL;
    }
    return hash;
}

}  // namespace

std::string QVReportingSafeFileComponent(std::string_view text, std::size_t maxLength) {
    maxLength = std::max<std::size_t>(maxLength, 1);
    if (text.empty()) {
        return "%";
    }

    // Whole pieces (one character or one escape each), so a cut never splits either.
    std::vector<std::string> pieces;
    pieces.reserve(std::min<std::size_t>(text.size(), 4 * maxLength));
    std::size_t length = 0;
    for (std::size_t i = 0; i < text.size();) {
        const auto c = static_cast<unsigned char>(text[i]);
        std::string piece;
        std::size_t consumed = 1;
        if (c < 0x20 || c == 0x7F || c == '/' || c == '%' || (i == 0 && c == '.')) {
            piece = escaped(c);
        } else if (const std::size_t n = QVReportingUtf8SequenceLength(text, i); n == 0) {
            piece = escaped(c);
        } else {
            piece.assign(text.substr(i, n));
            consumed = n;
        }
        i += consumed;
        length += piece.size();
        pieces.push_back(std::move(piece));
        // Past this point the result is cut anyway; the rest only feeds the hash.
        if (length > maxLength) {
            break;
        }
    }

    const bool fits = length <= maxLength;
    const bool hashed = !fits && maxLength > kHashSuffixLength;
    const std::size_t budget =
        fits ? maxLength : (hashed ? maxLength - kHashSuffixLength : maxLength);
    std::string result;
    result.reserve(maxLength);
    for (const std::string& piece : pieces) {
        if (result.size() + piece.size() > budget) {
            break;
        }
        result += piece;
    }
    if (hashed) {
        const std::uint64_t hash = fnv1a(text);
        result += '~';
        for (int shift = 60; shift >= 0; shift -= 4) {
            result += kHex[(hash >> shift) & 0x0F];
        }
    }
    if (result.empty()) {
        // A limit smaller than the first piece: an escape of the first byte's low bits would
        // still not fit, so fall back to the one name that cannot clash with a whole result.
        return "%";
    }
    return result;
}

}  // namespace qv

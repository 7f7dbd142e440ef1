#include "platform/SafeFileName.h"

#include <algorithm>
#include <cstdint>
#include <vector>

namespace qv {

namespace {

constexpr char kHex[] = "0123456789ABCDEF";
// "~" and 16 hex digits mark a cut result.
constexpr std::size_t kHashSuffixLength = 17;

bool isContinuation(unsigned char c) {
    return (c & 0xC0) == 0x80;
}

// Length of the well-formed UTF-8 sequence that starts at text[i], or 0 when there is none
// (overlong forms, surrogates and code points above U+10FFFF are not well-formed).
std::size_t utf8SequenceLength(std::string_view text, std::size_t i) {
    const auto byte = [&](std::size_t k) { return static_cast<unsigned char>(text[i + k]); };
    const unsigned char c = byte(0);
    const std::size_t left = text.size() - i;
    if (c < 0x80) {
        return 1;
    }
    if (c >= 0xC2 && c <= 0xDF) {
        return left >= 2 && isContinuation(byte(1)) ? 2 : 0;
    }
    if (c >= 0xE0 && c <= 0xEF) {
        if (left < 3 || !isContinuation(byte(1)) || !isContinuation(byte(2))) {
            return 0;
        }
        if ((c == 0xE0 && byte(1) < 0xA0) || (c == 0xED && byte(1) > 0x9F)) {
            return 0;
        }
        return 3;
    }
    if (c >= 0xF0 && c <= 0xF4) {
        if (left < 4 || !isContinuation(byte(1)) || !isContinuation(byte(2)) ||
            !isContinuation(byte(3))) {
            return 0;
        }
        if ((c == 0xF0 && byte(1) < 0x90) || (c == 0xF4 && byte(1) > 0x8F)) {
            return 0;
        }
        return 4;
    }
    return 0;
}

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
        } else if (const std::size_t n = utf8SequenceLength(text, i); n == 0) {
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

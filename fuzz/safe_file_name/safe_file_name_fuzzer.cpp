// QVReportingSafeFileComponent on any bytes, with limits from 1 to past the length of the text.
//
// Properties:
// - the result is never empty, never longer than the limit, never "." or "..", never starts with
//   "." (no hidden file), and holds no "/", NUL, other control character or DEL;
// - the result is valid UTF-8, whatever the text;
// - every "%" in it starts an escape: two upper-case hex digits ("%" alone names the empty
//   text, or one whose first character does not fit the limit);
// - a result that fits without cutting reads back, escapes undone, to exactly the text (so two
//   texts that fit never share a result), and the text's own "%" is always escaped;
// - a cut result keeps a readable beginning of the text's own result and, when the limit leaves
//   room, ends in "~" and 16 upper-case hex digits; the same text always gives the same result.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "common/FuzzSupport.h"
#include "platform/SafeFileName.h"
#include "values/Utf8.h"

namespace {

using qv::fuzz::check;

bool isUpperHex(char c) {
    return (c >= '0' && c <= '9') || (c >= 'A' && c <= 'F');
}

int hexValue(char c) {
    return c <= '9' ? c - '0' : c - 'A' + 10;
}

// The text back from a result, escapes undone; false when an escape is malformed.
bool unescape(std::string_view result, std::string& out) {
    for (std::size_t i = 0; i < result.size(); ++i) {
        if (result[i] != '%') {
            out += result[i];
            continue;
        }
        if (i + 2 >= result.size() || !isUpperHex(result[i + 1]) || !isUpperHex(result[i + 2])) {
            return false;
        }
        out += static_cast<char>(hexValue(result[i + 1]) * 16 + hexValue(result[i + 2]));
        i += 2;
    }
    return true;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    qv::fuzz::FuzzInput in(data, size);
    const std::uint8_t b = in.byte();
    const std::string text = in.rest();
    // Small limits, limits near the text's length and the default.
    std::size_t limit = 0;
    switch (b % 4) {
        case 0:
            limit = b >> 2;
            break;
        case 1:
            limit = text.size() + 2 * (b >> 4) - 8;
            break;
        case 2:
            limit = 3 * text.size() - (b >> 2);
            break;
        default:
            limit = 128;
    }
    limit = std::max<std::size_t>(limit, 1);
    if (limit > 4 * text.size() + 64) {
        limit = 4 * text.size() + 64;
    }

    const std::string result = qv::QVReportingSafeFileComponent(text, limit);
    check(!result.empty() && result.size() <= limit);
    check(result != "." && result != ".." && result[0] != '.');
    for (const char c : result) {
        const auto u = static_cast<unsigned char>(c);
        check(c != '/' && u >= 0x20 && u != 0x7F);
    }
    check(qv::QVReportingIsValidUtf8(result));
    check(result == qv::QVReportingSafeFileComponent(text, limit));

    // "%" alone is the name of the empty text (and of a text whose first character does not fit
    // the limit); elsewhere every "%" starts a well-formed escape (a cut never splits one).
    if (result == "%") {
        const auto first = text.empty() ? 0 : static_cast<unsigned char>(text[0]);
        const bool plain =
            first >= 0x20 && first < 0x7F && first != '/' && first != '%' && first != '.';
        check(text.empty() ||
              (!plain && (limit < 3 || qv::QVReportingUtf8SequenceLength(text, 0) > limit)));
        return 0;
    }
    std::string back;
    check(unescape(result, back));

    // Escaping every byte outright at most triples the text; within such a limit nothing is cut.
    const bool roomy = limit >= 3 * text.size();
    const bool fits = !text.empty() && back == text;
    if (roomy && !text.empty()) {
        check(fits);
    }
    if (!fits && !text.empty() && limit > 17) {
        // Cut: a beginning of the text and the hash of the whole.
        check(result.size() >= 17 && result[result.size() - 17] == '~');
        for (std::size_t i = result.size() - 16; i < result.size(); ++i) {
            check(isUpperHex(result[i]));
        }
        std::string start;
        check(unescape(std::string_view(result).substr(0, result.size() - 17), start));
        check(text.compare(0, start.size(), start) == 0);
    }
    return 0;
}

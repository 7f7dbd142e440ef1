#include "values/ValueNumbers.h"

#include <charconv>
#include <cmath>
#include <limits>
#include <string_view>

#include "values/Value.h"

namespace qv {

namespace {

constexpr std::int64_t kInt64Max = std::numeric_limits<std::int64_t>::max();
constexpr std::int64_t kInt64Min = std::numeric_limits<std::int64_t>::min();

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

std::string_view skipBlanks(std::string_view text) {
    std::size_t i = 0;
    while (i < text.size() && (text[i] == ' ' || (text[i] >= '\t' && text[i] <= '\r'))) {
        ++i;
    }
    return text.substr(i);
}

std::int64_t leadingInteger(std::string_view text) {
    text = skipBlanks(text);
    bool negative = false;
    if (!text.empty() && (text[0] == '+' || text[0] == '-')) {
        negative = text[0] == '-';
        text.remove_prefix(1);
    }
    // Accumulated as a negative number, whose range holds the magnitude of INT64_MIN.
    std::int64_t acc = 0;
    for (char c : text) {
        if (!isDigit(c)) {
            break;
        }
        const int digit = c - '0';
        if (acc < (kInt64Min + digit) / 10) {
            return negative ? kInt64Min : kInt64Max;
        }
        acc = acc * 10 - digit;
    }
    if (negative) {
        return acc;
    }
    return acc == kInt64Min ? kInt64Max : -acc;
}

double leadingDouble(std::string_view text) {
    text = skipBlanks(text);
    // The longest prefix of the form [sign] digits [. digits] [e [sign] digits]; from_chars alone
    // would also take "inf", "nan" and hexadecimal forms, which are not numbers a person writes.
    std::size_t i = 0;
    if (i < text.size() && (text[i] == '+' || text[i] == '-')) {
        ++i;
    }
    const std::size_t mantissaStart = i;
    while (i < text.size() && isDigit(text[i])) {
        ++i;
    }
    std::size_t digits = i - mantissaStart;
    if (i < text.size() && text[i] == '.') {
        const std::size_t fractionStart = ++i;
        while (i < text.size() && isDigit(text[i])) {
            ++i;
        }
        digits += i - fractionStart;
    }
    if (digits == 0) {
        return 0.0;
    }
    if (i < text.size() && (text[i] == 'e' || text[i] == 'E')) {
        std::size_t j = i + 1;
        if (j < text.size() && (text[j] == '+' || text[j] == '-')) {
            ++j;
        }
        if (j < text.size() && isDigit(text[j])) {
            while (j < text.size() && isDigit(text[j])) {
                ++j;
            }
            i = j;
        }
    }
    // from_chars takes no leading "+".
    std::string_view number = text.substr(0, i);
    const bool negative = number[0] == '-';
    if (number[0] == '+' || number[0] == '-') {
        number.remove_prefix(1);
    }
    double result = 0.0;
    const auto [end, ec] = std::from_chars(number.data(), number.data() + number.size(), result,
                                           std::chars_format::general);
    (void)end;
    if (ec == std::errc::result_out_of_range) {
        // Overflow or underflow: tell them apart by the exponent's sign.
        const bool tiny = number.find("e-") != std::string_view::npos ||
                          number.find("E-") != std::string_view::npos;
        result = tiny ? 0.0 : std::numeric_limits<double>::infinity();
    } else if (ec != std::errc()) {
        return 0.0;
    }
    return negative ? -result : result;
}

std::int64_t doubleToInteger(double d) {
    if (std::isnan(d)) {
        return 0;
    }
    // 2^63 is exactly representable; every double below it converts without overflow.
    if (d >= 9223372036854775808.0) {
        return kInt64Max;
    }
    if (d <= -9223372036854775808.0) {
        return kInt64Min;
    }
    return static_cast<std::int64_t>(d);
}

}  // namespace

std::int64_t QVReportingIntegerValue(const Value* value) {
    if (value == nullptr) {
        return 0;
    }
    switch (value->kind()) {
        case Value::Kind::Bool:
        case Value::Kind::Int:
            return *value->asInt64();
        case Value::Kind::UInt: {
            const std::uint64_t u = *value->asUInt64();
            return u > static_cast<std::uint64_t>(kInt64Max) ? kInt64Max
                                                             : static_cast<std::int64_t>(u);
        }
        case Value::Kind::Double:
            return doubleToInteger(*value->asDouble());
        case Value::Kind::String:
            return leadingInteger(*value->asString());
        default:
            return 0;
    }
}

std::int32_t QVReportingIntValue(const Value* value) {
    const std::int64_t v = QVReportingIntegerValue(value);
    if (v > std::numeric_limits<std::int32_t>::max()) {
        return std::numeric_limits<std::int32_t>::max();
    }
    if (v < std::numeric_limits<std::int32_t>::min()) {
        return std::numeric_limits<std::int32_t>::min();
    }
    return static_cast<std::int32_t>(v);
}

double QVReportingDoubleValue(const Value* value) {
    if (value == nullptr) {
        return 0.0;
    }
    if (const std::string* text = value->asString()) {
        return leadingDouble(*text);
    }
    return value->doubleValue();
}

}  // namespace qv

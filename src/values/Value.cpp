#include "values/Value.h"

#include <fmt/format.h>

#include <algorithm>
#include <bit>
#include <charconv>
#include <cmath>
#include <ctime>
#include <functional>
#include <iterator>
#include <limits>
#include <system_error>

namespace qv {

namespace {

bool needsQuotes(std::string_view s) {
    if (s.empty()) {
        return true;
    }
    return !std::all_of(s.begin(), s.end(), [](char c) {
        return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
               c == '_' || c == '$' || c == '.' || c == '/' || c == ':';
    });
}

void appendQuoted(std::string& out, std::string_view s) {
    if (!needsQuotes(s)) {
        out += s;
        return;
    }
    out += '"';
    for (char c : s) {
        switch (c) {
            case '"':
                out += "\\\"";
                break;
            case '\\':
                out += "\\\\";
                break;
            case '\n':
                out += "\\n";
                break;
            default:
                out += c;
        }
    }
    out += '"';
}

void describe(const Value& v, std::string& out, int indent);

void describeDictionary(const Dictionary& d, std::string& out, int indent) {
    out += "{\n";
    for (const auto& [key, value] : d) {
        out.append(static_cast<std::size_t>(indent + 4), ' ');
        appendQuoted(out, key);
        out += " = ";
        describe(value, out, indent + 4);
        out += ";\n";
    }
    out.append(static_cast<std::size_t>(indent), ' ');
    out += '}';
}

void describe(const Value& v, std::string& out, int indent) {
    using K = Value::Kind;
    switch (v.kind()) {
        case K::Null:
            out += "<null>";
            break;
        case K::Bool:
            out += v.boolValue() ? '1' : '0';
            break;
        case K::Int:
            out += fmt::to_string(*v.asInt64());
            break;
        case K::UInt:
            out += fmt::to_string(*v.asUInt64());
            break;
        case K::Double:
            // The shortest text that reads back as the same number.
            out += fmt::format("{}", *v.asDouble());
            break;
        case K::String:
            appendQuoted(out, *v.asString());
            break;
        case K::Bytes: {
            const Bytes& b = *v.asBytes();
            out += fmt::format("{{length = {}, bytes = 0x", b.size());
            const std::size_t shown = std::min<std::size_t>(b.size(), 24);
            for (std::size_t i = 0; i < shown; ++i) {
                out += fmt::format("{:02x}", b[i]);
            }
            out += b.size() > shown ? "...}" : "}";
            break;
        }
        case K::Date: {
            const double secs = v.asDate()->secondsSince1970;
            if (!std::isfinite(secs) || std::fabs(secs) > 1e15) {
                out += fmt::format("{}", secs);
                break;
            }
            const std::time_t t = static_cast<std::time_t>(std::floor(secs));
            std::tm tm{};
            gmtime_r(&t, &tm);
            char buf[64];
            std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
            out += buf;
            break;
        }
        case K::Array: {
            const Array& a = *v.asArray();
            out += "(\n";
            for (std::size_t i = 0; i < a.size(); ++i) {
                out.append(static_cast<std::size_t>(indent + 4), ' ');
                describe(a[i], out, indent + 4);
                out += i + 1 < a.size() ? ",\n" : "\n";
            }
            out.append(static_cast<std::size_t>(indent), ' ');
            out += ')';
            break;
        }
        case K::Dictionary:
            describeDictionary(*v.asDictionary(), out, indent);
            break;
    }
}

}  // namespace

Value::Value(Array a) : v_(std::make_shared<const Array>(std::move(a))) {}
Value::Value(Dictionary d) : v_(std::make_shared<const Dictionary>(std::move(d))) {}

bool Value::isNumber() const {
    switch (kind()) {
        case Kind::Bool:
        case Kind::Int:
        case Kind::UInt:
        case Kind::Double:
            return true;
        default:
            return false;
    }
}

const Bytes* Value::asBytes() const {
    const auto* p = std::get_if<std::shared_ptr<const Bytes>>(&v_);
    return p ? p->get() : nullptr;
}

const Array* Value::asArray() const {
    const auto* p = std::get_if<std::shared_ptr<const Array>>(&v_);
    return p ? p->get() : nullptr;
}

const Dictionary* Value::asDictionary() const {
    const auto* p = std::get_if<std::shared_ptr<const Dictionary>>(&v_);
    return p ? p->get() : nullptr;
}

std::optional<Date> Value::asDate() const {
    if (const auto* d = std::get_if<Date>(&v_)) {
        return *d;
    }
    return std::nullopt;
}

std::optional<double> Value::asDouble() const {
    switch (kind()) {
        case Kind::Bool:
            return std::get<bool>(v_) ? 1.0 : 0.0;
        case Kind::Int:
            return static_cast<double>(std::get<std::int64_t>(v_));
        case Kind::UInt:
            return static_cast<double>(std::get<std::uint64_t>(v_));
        case Kind::Double:
            return std::get<double>(v_);
        default:
            return std::nullopt;
    }
}

std::optional<std::int64_t> Value::asInt64() const {
    switch (kind()) {
        case Kind::Bool:
            return std::get<bool>(v_) ? 1 : 0;
        case Kind::Int:
            return std::get<std::int64_t>(v_);
        case Kind::UInt: {
            const auto u = std::get<std::uint64_t>(v_);
            return u > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())
                       ? std::numeric_limits<std::int64_t>::max()
                       : static_cast<std::int64_t>(u);
        }
        case Kind::Double: {
            // Clamped: converting NaN or an out-of-range double to an integer is undefined.
            const double d = std::get<double>(v_);
            if (std::isnan(d)) {
                return 0;
            }
            if (d >= 9223372036854775807.0) {
                return std::numeric_limits<std::int64_t>::max();
            }
            if (d <= -9223372036854775808.0) {
                return std::numeric_limits<std::int64_t>::min();
            }
            return static_cast<std::int64_t>(d);
        }
        default:
            return std::nullopt;
    }
}

std::optional<std::uint64_t> Value::asUInt64() const {
    if (const auto* u = std::get_if<std::uint64_t>(&v_)) {
        return *u;
    }
    return std::nullopt;
}

namespace {

bool isBlank(char c) {
    return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f';
}

bool isDigit(char c) {
    return c >= '0' && c <= '9';
}

// The decimal number text starts with, after white space: [sign] digits [. digits] [exponent];
// empty when text does not start with one.
std::string_view leadingNumber(std::string_view text, bool integerOnly) {
    std::size_t i = 0;
    while (i < text.size() && isBlank(text[i])) {
        ++i;
    }
    const std::size_t start = i;
    if (i < text.size() && (text[i] == '+' || text[i] == '-')) {
        ++i;
    }
    std::size_t digits = 0;
    while (i < text.size() && isDigit(text[i])) {
        ++i;
        ++digits;
    }
    if (!integerOnly && i < text.size() && text[i] == '.') {
        ++i;
        while (i < text.size() && isDigit(text[i])) {
            ++i;
            ++digits;
        }
    }
    if (digits == 0) {
        return {};
    }
    if (!integerOnly && i < text.size() && (text[i] == 'e' || text[i] == 'E')) {
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
    return text.substr(start, i - start);
}

double leadingDouble(std::string_view text) {
    std::string_view number = leadingNumber(text, /*integerOnly=*/false);
    if (number.empty()) {
        return 0.0;
    }
    const bool negative = number.front() == '-';
    if (number.front() == '+' || negative) {
        number.remove_prefix(1);  // from_chars takes no '+', and reads the sign below
    }
    double d = 0.0;
    const auto [end, error] = std::from_chars(number.data(), number.data() + number.size(), d);
    if (error == std::errc::result_out_of_range) {
        // Too large reads as infinity; too small to hold reads as zero.
        const bool tooLarge = [&] {
            const auto e = number.find_first_of("eE");
            return e == std::string_view::npos || number[e + 1] != '-';
        }();
        d = tooLarge ? std::numeric_limits<double>::infinity() : 0.0;
    }
    return negative ? -d : d;
}

std::int64_t leadingInteger(std::string_view text) {
    std::string_view number = leadingNumber(text, /*integerOnly=*/true);
    if (number.empty()) {
        return 0;
    }
    const bool negative = number.front() == '-';
    if (number.front() == '+') {
        number.remove_prefix(1);
    }
    std::int64_t n = 0;
    const auto [end, error] = std::from_chars(number.data(), number.data() + number.size(), n);
    if (error == std::errc::result_out_of_range) {
        return negative ? std::numeric_limits<std::int64_t>::min()
                        : std::numeric_limits<std::int64_t>::max();
    }
    return n;
}

}  // namespace

double Value::doubleValue() const {
    if (const auto* s = asString()) {
        return leadingDouble(*s);
    }
    return asDouble().value_or(0.0);
}

std::int64_t Value::longLongValue() const {
    if (const auto* s = asString()) {
        return leadingInteger(*s);
    }
    return asInt64().value_or(0);
}

std::int32_t Value::intValue() const {
    if (const auto* s = asString()) {
        return static_cast<std::int32_t>(
            std::clamp<std::int64_t>(leadingInteger(*s), std::numeric_limits<std::int32_t>::min(),
                                     std::numeric_limits<std::int32_t>::max()));
    }
    return static_cast<std::int32_t>(
        static_cast<std::uint32_t>(static_cast<std::uint64_t>(asInt64().value_or(0))));
}

bool Value::boolValue() const {
    if (const auto* s = asString()) {
        std::size_t i = 0;
        while (i < s->size() && ((*s)[i] == ' ' || (*s)[i] == '\t' || (*s)[i] == '\n')) {
            ++i;
        }
        if (i < s->size() && ((*s)[i] == '+' || (*s)[i] == '-')) {
            ++i;
        }
        while (i < s->size() && (*s)[i] == '0') {
            ++i;
        }
        if (i == s->size()) {
            return false;
        }
        const char c = (*s)[i];
        return c == 'Y' || c == 'y' || c == 'T' || c == 't' || (c >= '1' && c <= '9');
    }
    const auto d = asDouble();
    return d && *d != 0.0;
}

std::optional<__int128> Value::asExactInteger() const {
    switch (kind()) {
        case Kind::Bool:
            return std::get<bool>(v_) ? 1 : 0;
        case Kind::Int:
            return std::get<std::int64_t>(v_);
        case Kind::UInt:
            return std::get<std::uint64_t>(v_);
        default:
            return std::nullopt;
    }
}

bool Value::numbersEqual(const Value& other) const {
    const auto a = asExactInteger();
    const auto b = other.asExactInteger();
    if (a && b) {
        return *a == *b;  // exact, where doubles would lose digits beyond 2^53
    }
    if (!a && !b) {
        return std::get<double>(v_) == std::get<double>(other.v_);
    }
    const double d = a ? std::get<double>(other.v_) : std::get<double>(v_);
    const __int128 i = a ? *a : *b;
    // Only an integral double within the integer range can equal an integer.
    if (!(d >= -1.9e19 && d <= 1.9e19) || d != std::trunc(d)) {
        return false;
    }
    return static_cast<__int128>(d) == i;
}

bool Value::operator==(const Value& other) const {
    if (isNumber() && other.isNumber()) {
        return numbersEqual(other);
    }
    if (kind() != other.kind()) {
        return false;
    }
    switch (kind()) {
        case Kind::Null:
            return true;
        case Kind::String:
            return *asString() == *other.asString();
        case Kind::Bytes:
            return *asBytes() == *other.asBytes();
        case Kind::Date:
            return *asDate() == *other.asDate();
        case Kind::Array:
            return asArray() == other.asArray() || *asArray() == *other.asArray();
        case Kind::Dictionary:
            return asDictionary() == other.asDictionary() ||
                   *asDictionary() == *other.asDictionary();
        default:
            return false;
    }
}

std::string Value::description() const {
    std::string out;
    describe(*this, out, 0);
    return out;
}

std::string QVReportingValueText(const Value* value) {
    if (value == nullptr) {
        return "(null)";
    }
    if (const std::string* s = value->asString()) {
        return *s;
    }
    return value->description();
}

bool Value::sameAs(const Value& other) const {
    if (v_.index() != other.v_.index()) {
        return false;
    }
    const auto bits = [](double d) { return std::bit_cast<std::uint64_t>(d); };
    if (const double* d = std::get_if<double>(&v_)) {
        return bits(*d) == bits(std::get<double>(other.v_));
    }
    if (const Date* d = std::get_if<Date>(&v_)) {
        return bits(d->secondsSince1970) == bits(std::get<Date>(other.v_).secondsSince1970);
    }
    // Shared containers compare as pointers here.
    return v_ == other.v_;
}

Value Value::deepCopy() const {
    if (const Array* a = asArray()) {
        Array copy;
        copy.reserve(a->size());
        for (const Value& v : *a) {
            copy.push_back(v.deepCopy());
        }
        return Value(std::move(copy));
    }
    if (const Dictionary* d = asDictionary()) {
        Dictionary copy;
        copy.reserve(d->size());
        for (const auto& [k, v] : *d) {
            copy.set(k, v.deepCopy());
        }
        return Value(std::move(copy));
    }
    if (const Bytes* b = asBytes()) {
        return Value(Bytes(*b));
    }
    return *this;
}

std::size_t Value::valueCount() const {
    std::size_t n = 1;
    if (const Array* a = asArray()) {
        for (const Value& v : *a) {
            n += v.valueCount();
        }
    } else if (const Dictionary* d = asDictionary()) {
        for (const auto& entry : *d) {
            n += entry.second.valueCount();
        }
    }
    return n;
}

namespace {

// What the allocator adds to each block it hands out (its header, and rounding up).
constexpr std::size_t kAllocationOverhead = 16;

std::size_t stringHeapBytes(const std::string& s) {
    // Short strings live inside the object itself.
    return s.capacity() > 15 ? s.capacity() + 1 + kAllocationOverhead : 0;
}

// A block made by make_shared: the object, its control block and the allocator's share.
template <typename T>
constexpr std::size_t kSharedBlockBytes = sizeof(T) + 16 + kAllocationOverhead;

}  // namespace

std::size_t Value::approximateHeapBytes() const {
    switch (kind()) {
        case Kind::String:
            return stringHeapBytes(*asString());
        case Kind::Bytes:
            return kSharedBlockBytes<Bytes> + asBytes()->capacity() + kAllocationOverhead;
        case Kind::Array: {
            const Array& a = *asArray();
            std::size_t n =
                kSharedBlockBytes<Array> + a.capacity() * sizeof(Value) + kAllocationOverhead;
            for (const Value& v : a) {
                n += v.approximateHeapBytes();
            }
            return n;
        }
        case Kind::Dictionary:
            return kSharedBlockBytes<Dictionary> + asDictionary()->approximateHeapBytes();
        default:
            return 0;
    }
}

std::size_t Value::depth() const {
    std::size_t deepest = 0;
    if (const Array* a = asArray()) {
        for (const Value& v : *a) {
            deepest = std::max(deepest, v.depth());
        }
        return deepest + 1;
    }
    if (const Dictionary* d = asDictionary()) {
        for (const auto& entry : *d) {
            deepest = std::max(deepest, entry.second.depth());
        }
        return deepest + 1;
    }
    return 0;
}

// A dictionary's estimate and description sit with the values' own; its mechanics are in
// Dictionary.cpp.

std::size_t Dictionary::approximateHeapBytes() const {
    std::size_t n = 0;
    if (entries_.capacity() > 0) {
        n += entries_.capacity() * sizeof(Entry) + kAllocationOverhead;
    }
    if (slots_.capacity() > 0) {
        n += slots_.capacity() * sizeof(slots_[0]) + kAllocationOverhead;
    }
    for (const auto& [key, value] : entries_) {
        n += key.ownedHeapBytes() + value.approximateHeapBytes();
    }
    return n;
}

std::string Dictionary::description() const {
    std::string out;
    describeDictionary(*this, out, 0);
    return out;
}

}  // namespace qv

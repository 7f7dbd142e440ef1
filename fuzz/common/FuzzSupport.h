// What the fuzz targets share: reading a fuzzer's bytes as a stream of choices, a check that stops
// the run, a scratch directory for readers of files, values of every kind made from bytes, and a
// comparison of values stricter than Value's own (kinds, key order and the bits of doubles must
// match, so that NaN equals itself and 1 does not pass for 1.0).
#pragma once

#include <stdlib.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <limits>
#include <string>
#include <string_view>

#include "values/Value.h"

namespace qv::fuzz {

// Breaks into the fuzzer (which saves the input) when a property does not hold.
inline void check(bool condition) {
    if (!condition) {
        __builtin_trap();
    }
}

// A private directory for readers that only take a path, made once per process (in memory when
// /dev/shm is there, so that writing and syncing files costs little) and removed at exit.
inline const std::string& scratchDirectory() {
    // Never destroyed: the exit handler that removes the directory runs after static objects
    // made later than it are gone.
    static const std::string* const directory = [] {
        auto* made = new std::string(
            std::string(::access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp") + "/qv-fuzz-XXXXXX");
        check(::mkdtemp(made->data()) != nullptr);
        std::atexit([] {
            std::error_code ignored;
            std::filesystem::remove_all(scratchDirectory(), ignored);
        });
        return made;
    }();
    return *directory;
}

// Replaces the file's contents with text.
inline void writeFile(const std::string& path, const std::string& text) {
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << text;
    out.close();
    check(static_cast<bool>(out));
}

inline std::string readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

// The input, read front to back; reads past the end give zeros, so that every input means
// something.
class FuzzInput {
  public:
    FuzzInput(const std::uint8_t* data, std::size_t size) : data_(data), size_(size) {}

    bool empty() const { return position_ >= size_; }
    std::size_t left() const { return empty() ? 0 : size_ - position_; }

    std::uint8_t byte() { return empty() ? 0 : data_[position_++]; }
    std::uint16_t u16() { return static_cast<std::uint16_t>(byte() | (byte() << 8)); }
    std::uint32_t u32() { return u16() | (static_cast<std::uint32_t>(u16()) << 16); }
    std::uint64_t u64() { return u32() | (static_cast<std::uint64_t>(u32()) << 32); }
    double f64() {
        const std::uint64_t bits = u64();
        double d = 0;
        std::memcpy(&d, &bits, sizeof d);
        return d;
    }
    // Up to n raw bytes (fewer at the end of the input).
    std::string bytes(std::size_t n) {
        n = std::min(n, left());
        std::string out(reinterpret_cast<const char*>(data_ + position_), n);
        position_ += n;
        return out;
    }
    // The rest of the input.
    std::string rest() { return bytes(left()); }

  private:
    const std::uint8_t* data_;
    std::size_t size_;
    std::size_t position_ = 0;
};

// Text that is always valid UTF-8 without NUL: ASCII bytes stand for themselves, the others pick
// a character of two, three or four bytes.
inline std::string validText(FuzzInput& in, std::size_t maxLength) {
    static constexpr std::string_view kWide[] = {
        "\xC3\xA9", "\xE2\x82\xAC", "\xF0\x9F\x8E\xB5", "\xEF\xBF\xBF", "\xF4\x8F\xBF\xBF", " "};
    const std::size_t length = in.byte() % (maxLength + 1);
    std::string out;
    for (std::size_t i = 0; i < length && !in.empty(); ++i) {
        const std::uint8_t b = in.byte();
        if (b != 0 && b < 0x80) {
            out += static_cast<char>(b);
        } else {
            out += kWide[b % std::size(kWide)];
        }
    }
    return out;
}

// A value of any kind, nested at most depth deep, made from the input. With rawStrings, some
// strings and keys are raw bytes, so not always valid UTF-8.
inline Value makeValue(FuzzInput& in, int depth, bool rawStrings) {
    enum Choice {
        kInt,
        kDouble,
        kString,
        kBool,
        kUInt,
        kRound,
        kBytes,
        kDate,
        kNull,
        kArray,
        kDict
    };
    const std::uint8_t tag = in.byte();
    switch (static_cast<Choice>(tag % (depth > 0 ? kDict + 1 : kArray))) {
        case kInt:
            return Value(static_cast<std::int64_t>(in.u64()));
        case kDouble:
            return Value(in.f64());
        case kString:
            return rawStrings && (tag & 0x80) ? Value(in.bytes(in.byte() % 24))
                                              : Value(validText(in, 24));
        case kBool:
            return Value((tag & 0x80) != 0);
        case kUInt:
            // Small and large: either side of the signed range's end.
            return (tag & 0x80) ? Value(in.u64()) : Value(std::uint64_t{in.byte()});
        case kRound:
            // Doubles that look like integers, and short fractions.
            return Value((tag & 0x80)
                             ? static_cast<double>(static_cast<std::int32_t>(in.u32()))
                             : static_cast<double>(static_cast<std::int8_t>(in.byte())) / 8.0);
        case kBytes: {
            const std::size_t n = in.byte() % 16;
            return Value(Bytes(n, in.byte()));
        }
        case kDate:
            return (tag & 0x80) ? Value(Date{in.f64()})
                                : Value(Date{1.7e9 + static_cast<double>(in.u32()) / 1024.0});
        case kNull:
            return Value(nullptr);
        case kArray: {
            Array array;
            for (std::size_t i = 0, n = in.byte() % 5; i < n; ++i) {
                array.push_back(makeValue(in, depth - 1, rawStrings));
            }
            return Value(std::move(array));
        }
        case kDict:
            break;
    }
    Dictionary dictionary;
    for (std::size_t i = 0, n = in.byte() % 5; i < n; ++i) {
        const std::string key =
            rawStrings && (in.byte() & 1) ? in.bytes(in.byte() % 12) : validText(in, 12);
        dictionary.set(key, makeValue(in, depth - 1, rawStrings));
    }
    return Value(std::move(dictionary));
}

// Standard base64 with padding, written out here so that the project's encoder is checked
// against something other than itself.
inline std::string base64(const Bytes& bytes) {
    static constexpr char kAlphabet[] =
        "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
    std::string out;
    std::size_t i = 0;
    for (; i + 3 <= bytes.size(); i += 3) {
        const std::uint32_t n = (bytes[i] << 16) | (bytes[i + 1] << 8) | bytes[i + 2];
        for (int shift = 18; shift >= 0; shift -= 6) {
            out += kAlphabet[(n >> shift) & 63];
        }
    }
    if (bytes.size() - i == 1) {
        const std::uint32_t n = bytes[i] << 16;
        out += {kAlphabet[n >> 18], kAlphabet[(n >> 12) & 63], '=', '='};
    } else if (bytes.size() - i == 2) {
        const std::uint32_t n = (bytes[i] << 16) | (bytes[i + 1] << 8);
        out += {kAlphabet[n >> 18], kAlphabet[(n >> 12) & 63], kAlphabet[(n >> 6) & 63], '='};
    }
    return out;
}

// What a value becomes when written as JSON and read back: bytes turn into their base64 text,
// dates into doubles, doubles and dates that are not finite into null, unsigned integers that fit
// the signed range into signed ones. Strings must be valid UTF-8.
inline Value afterJson(const Value& value) {
    using K = Value::Kind;
    switch (value.kind()) {
        case K::UInt:
            if (*value.asUInt64() <=
                static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
                return Value(static_cast<std::int64_t>(*value.asUInt64()));
            }
            return value;
        case K::Double:
            return std::isfinite(*value.asDouble()) ? value : Value(nullptr);
        case K::Date: {
            const double d = value.asDate()->secondsSince1970;
            return std::isfinite(d) ? Value(d) : Value(nullptr);
        }
        case K::Bytes:
            return Value(base64(*value.asBytes()));
        case K::Array: {
            Array array;
            for (const Value& item : *value.asArray()) {
                array.push_back(afterJson(item));
            }
            return Value(std::move(array));
        }
        case K::Dictionary: {
            Dictionary dictionary;
            for (const auto& [key, item] : *value.asDictionary()) {
                dictionary.set(key, afterJson(item));
            }
            return Value(std::move(dictionary));
        }
        default:
            return value;
    }
}

// The same value in every detail: kind, bits of doubles, order of keys.
inline bool sameValue(const Value& a, const Value& b);

inline bool sameDictionary(const Dictionary& a, const Dictionary& b) {
    if (a.size() != b.size()) {
        return false;
    }
    for (auto i = a.begin(), j = b.begin(); i != a.end(); ++i, ++j) {
        if (i->first.view() != j->first.view() || !sameValue(i->second, j->second)) {
            return false;
        }
    }
    return true;
}

inline bool sameDouble(double a, double b) {
    return std::memcmp(&a, &b, sizeof a) == 0 || (std::isnan(a) && std::isnan(b));
}

inline bool sameValue(const Value& a, const Value& b) {
    if (a.kind() != b.kind()) {
        return false;
    }
    using K = Value::Kind;
    switch (a.kind()) {
        case K::Null:
            return true;
        case K::Bool:
            return a.boolValue() == b.boolValue();
        case K::Int:
            return *a.asInt64() == *b.asInt64();
        case K::UInt:
            return *a.asUInt64() == *b.asUInt64();
        case K::Double:
            return sameDouble(*a.asDouble(), *b.asDouble());
        case K::String:
            return *a.asString() == *b.asString();
        case K::Bytes:
            return *a.asBytes() == *b.asBytes();
        case K::Date:
            return sameDouble(a.asDate()->secondsSince1970, b.asDate()->secondsSince1970);
        case K::Array: {
            const Array& x = *a.asArray();
            const Array& y = *b.asArray();
            if (x.size() != y.size()) {
                return false;
            }
            for (std::size_t i = 0; i < x.size(); ++i) {
                if (!sameValue(x[i], y[i])) {
                    return false;
                }
            }
            return true;
        }
        case K::Dictionary:
            return sameDictionary(*a.asDictionary(), *b.asDictionary());
    }
    return false;
}

}  // namespace qv::fuzz

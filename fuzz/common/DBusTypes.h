// D-Bus types for fuzz targets that build messages: types chosen by the input (within what the
// bus accepts), their signatures and nesting, and a walk of a message with the bus library alone.
#pragma once

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/Message.h>
#include <sdbus-c++/Types.h>

typedef struct sd_bus_message sd_bus_message;

#include "common/FuzzSupport.h"

namespace qv::fuzz {

// A D-Bus type: a basic code, 'a' (one item), '(' (a struct of items), '{' (a dict entry: key,
// value; only inside an array) or 'v'.
struct Type {
    char code = 's';
    std::vector<Type> items;
};

inline std::string signatureOf(const Type& type) {
    switch (type.code) {
        case 'a':
            return "a" + signatureOf(type.items[0]);
        case '(':
        case '{': {
            std::string s(1, type.code);
            for (const Type& item : type.items) {
                s += signatureOf(item);
            }
            return s + (type.code == '(' ? ")" : "}");
        }
        default:
            return std::string(1, type.code);
    }
}

constexpr std::string_view kBasic = "bynqiuxtdsogh";
// The bus allows 32 nested arrays and 32 nested structs in one signature; going a little past
// the reader's depth limit within one signature is enough, variants reach further.
constexpr int kMaxSignatureNesting = 20;
constexpr std::size_t kMaxSignatureLength = 255;

inline Type makeType(FuzzInput& in, int nesting) {
    const std::uint8_t b = in.byte();
    if (nesting >= kMaxSignatureNesting) {
        return {kBasic[b % kBasic.size()], {}};
    }
    switch (b % 20) {
        case 13:
            return {'v', {}};
        case 14:
        case 15:
            return {'a', {makeType(in, nesting + 1)}};
        case 16:
            return {'a', {{'y', {}}}};
        case 17: {
            Type s{'(', {}};
            for (int i = 0, n = 1 + in.byte() % 4; i < n; ++i) {
                s.items.push_back(makeType(in, nesting + 1));
            }
            return s;
        }
        case 18:
        case 19: {
            const Type key{kBasic[in.byte() % kBasic.size()], {}};
            return {'a', {{'{', {key, makeType(in, nesting + 1)}}}};
        }
        default:
            return {kBasic[b % kBasic.size()], {}};
    }
}

// Containers a value of this type opens, one inside the other at most (a variant counts as one:
// what it holds is chosen when it is written).
inline int nestingOf(const Type& type) {
    int deepest = 0;
    for (const Type& item : type.items) {
        deepest = std::max(deepest, nestingOf(item));
    }
    switch (type.code) {
        case 'a':
        case '(':
        case '{':
        case 'v':
            return deepest + 1;
        default:
            return 0;
    }
}

// A message may nest containers, variants included, at most 64 deep: the bus refuses deeper
// ones, so no client can send them.
constexpr int kMaxMessageNesting = 64;

// A type whose signature the bus accepts.
inline Type makeBoundedType(FuzzInput& in) {
    Type t = makeType(in, 0);
    if (signatureOf(t).size() > kMaxSignatureLength) {
        t = {'s', {}};
    }
    return t;
}

// Walks every value of the message with the bus library alone. Some messages it writes (seen
// with long variant signatures) it then cannot read back: those say nothing about our reader.
template <typename T>
inline void skip(sdbus::Message& m) {
    T value{};
    m >> value;
}

inline void walk(sdbus::Message& m) {
    std::string type, contents;
    for (m.peekType(type, contents); !type.empty() && type[0] != '\0'; m.peekType(type, contents)) {
        switch (type[0]) {
            case 'a':
                m.enterContainer(contents);
                walk(m);
                m.exitContainer();
                break;
            case 'r':
                m.enterStruct(contents);
                walk(m);
                m.exitStruct();
                break;
            case 'e':
                m.enterDictEntry(contents);
                walk(m);
                m.exitDictEntry();
                break;
            case 'v':
                m.enterVariant(contents);
                walk(m);
                m.exitVariant();
                break;
            case 'b':
                skip<bool>(m);
                break;
            case 'y':
                skip<std::uint8_t>(m);
                break;
            case 'n':
                skip<std::int16_t>(m);
                break;
            case 'q':
                skip<std::uint16_t>(m);
                break;
            case 'i':
                skip<std::int32_t>(m);
                break;
            case 'u':
                skip<std::uint32_t>(m);
                break;
            case 'x':
                skip<std::int64_t>(m);
                break;
            case 't':
                skip<std::uint64_t>(m);
                break;
            case 'd':
                skip<double>(m);
                break;
            case 's':
                skip<std::string>(m);
                break;
            case 'o':
                skip<sdbus::ObjectPath>(m);
                break;
            case 'g':
                skip<sdbus::Signature>(m);
                break;
            case 'h':
                skip<sdbus::UnixFd>(m);
                break;
            default:
                check(false);
        }
    }
}

// The sd_bus_message under an sdbus-c++ message (the daemon's readers take sd-bus's own), which
// sdbus-c++ keeps protected: a pointer to the member, taken in a derived class, reads it.
struct RawMessage : sdbus::Message {
    static sd_bus_message* of(const sdbus::Message& message) {
        return static_cast<sd_bus_message*>(message.*(&RawMessage::msg_));
    }
};

inline bool libraryReads(sdbus::Message& m) {
    m.rewind(true);
    try {
        walk(m);
    } catch (const sdbus::Error&) {
        return false;
    }
    return true;
}

}  // namespace qv::fuzz

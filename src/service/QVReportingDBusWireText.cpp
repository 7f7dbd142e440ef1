#include "service/QVReportingDBusWireText.h"

#include <cstdint>

namespace qv::dbuswire {

namespace {

constexpr int kMaxSignatureNesting = 32;  // arrays, and structs, in a type

// The length of the complete type that starts sig, 0 when none does.
std::size_t completeType(std::string_view sig, int arrays, int structs) {
    if (sig.empty()) {
        return 0;
    }
    const char c = sig[0];
    if (isBasicType(c) || c == 'v') {
        return 1;
    }
    if (c == 'a') {
        if (arrays >= kMaxSignatureNesting) {
            return 0;
        }
        if (sig.size() > 1 && sig[1] == '{') {
            if (structs >= kMaxSignatureNesting || sig.size() < 3 || !isBasicType(sig[2])) {
                return 0;
            }
            const std::size_t value = completeType(sig.substr(3), arrays + 1, structs + 1);
            return value && sig.size() > 3 + value && sig[3 + value] == '}' ? value + 4 : 0;
        }
        const std::size_t item = completeType(sig.substr(1), arrays + 1, structs);
        return item ? item + 1 : 0;
    }
    if (c == '(') {
        if (structs >= kMaxSignatureNesting) {
            return 0;
        }
        std::size_t at = 1;
        while (at < sig.size() && sig[at] != ')') {
            const std::size_t item = completeType(sig.substr(at), arrays, structs + 1);
            if (!item) {
                return 0;
            }
            at += item;
        }
        return at < sig.size() && at > 1 ? at + 1 : 0;
    }
    return 0;
}

}  // namespace

bool isBasicType(char c) {
    return std::string_view("ybnqiuxtdsogh").find(c) != std::string_view::npos;
}

std::size_t completeTypeLength(std::string_view sig) {
    return completeType(sig, 0, 0);
}

bool isValidSignature(std::string_view sig) {
    if (sig.size() > 255) {
        return false;
    }
    while (!sig.empty()) {
        const std::size_t n = completeTypeLength(sig);
        if (!n) {
            return false;
        }
        sig.remove_prefix(n);
    }
    return true;
}

bool isValidObjectPath(std::string_view path) {
    if (path.empty() || path[0] != '/') {
        return false;
    }
    if (path.size() == 1) {
        return true;
    }
    char previous = '\0';
    for (char c : path) {
        const bool word =
            (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_';
        if (!word && !(c == '/' && previous != '/')) {
            return false;
        }
        previous = c;
    }
    return previous != '/';
}

}  // namespace qv::dbuswire

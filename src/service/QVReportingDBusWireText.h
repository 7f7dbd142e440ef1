// The texts a D-Bus message carries, checked as D-Bus defines them: object paths are "/" or
// slash-separated words, signatures are complete types nested at most 32 arrays and 32 structs
// deep, at most 255 bytes. Its strings are UTF-8 as QVReportingIsValidUtf8 checks it
// (values/Utf8.h), noncharacters included.
//
// Thread safety: no state.
#pragma once

#include <cstddef>
#include <string_view>

namespace qv::dbuswire {

bool isBasicType(char code);
// The length of the complete type that starts sig; 0 when none does.
std::size_t completeTypeLength(std::string_view sig);
bool isValidSignature(std::string_view sig);
bool isValidObjectPath(std::string_view path);

}  // namespace qv::dbuswire

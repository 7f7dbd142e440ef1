// Serialisation of payload values as XML property lists (format version 1.0), and the three
// text forms of that buffer. Class operations only.
//
// A property list is made of dictionaries, arrays, strings, booleans, integers, reals, dates and
// data. A value holding null anywhere, a string or key with a NUL character (which the XML form
// cannot carry), or a date outside the years 1000 to 9999 (XML dates have four-digit years) is
// not a property list: every operation then returns nothing. Dates are written to the second.
//
// Thread safety: pure functions.
#pragma once

#include <optional>
#include <string>

#include "values/Value.h"

namespace qv {

class DataSerialize {
  public:
    DataSerialize() = delete;

    // The XML property list of value, or nothing when value is not a property list.
    static std::optional<Bytes> getPlistBlob(const Value& value);
    // That buffer as ASCII text; nothing when it holds a byte above 0x7F (a non-ASCII string).
    static std::optional<std::string> getXMLInfo(const Value& value);
    // That buffer as UTF-8 text; nothing when it is not valid UTF-8 (a string that was not).
    static std::optional<std::string> getDataXMLInfo(const Value& value);
    // That buffer in base64 (standard alphabet, padded, no line breaks).
    static std::optional<std::string> getBase64XMLBlob(const Value& value);
};

}  // namespace qv

#include "workers/backends/mtx/MTXWireFormat.h"

#include <charconv>

namespace mtxmetrics {

namespace {

constexpr int kMaxVarintBytes = 10;

void appendDecimal(std::string& out, auto value) {
    char buffer[24];
    const auto result = std::to_chars(buffer, buffer + sizeof buffer, value);
    out.append(buffer, result.ptr);
}

void appendEscaped(std::string& out, std::string_view bytes) {
    out += '"';
    for (const char c : bytes) {
        const auto b = static_cast<unsigned char>(c);
        switch (c) {
            case '\n':
                out += "\\n";
                break;
            case '\r':
                out += "\\r";
                break;
            case '\t':
                out += "\\t";
                break;
            case '"':
                out += "\\\"";
                break;
            case '\'':
                out += "\\'";
                break;
            case '\\':
                out += "\\\\";
                break;
            default:
                if (b >= 0x20 && b < 0x7f) {
                    out += c;
                } else {
                    out += '\\';
                    out += static_cast<char>('0' + ((b >> 6) & 7));
                    out += static_cast<char>('0' + ((b >> 3) & 7));
                    out += static_cast<char>('0' + (b & 7));
                }
        }
    }
    out += '"';
}

}  // namespace

// --- Writer -----------------------------------------------------------------------------------

void Writer::appendVarint(std::uint64_t value) {
    while (value >= 0x80) {
        data_ += static_cast<char>((value & 0x7f) | 0x80);
        value >>= 7;
    }
    data_ += static_cast<char>(value);
}

void Writer::appendTag(std::uint32_t fieldNumber, WireType wireType) {
    appendVarint((std::uint64_t{fieldNumber} << 3) | wireType);
}

void Writer::writeVarint(std::uint64_t value, std::uint32_t fieldNumber) {
    appendTag(fieldNumber, kWireTypeVarint);
    appendVarint(value);
}

void Writer::writeInt32(std::int32_t value, std::uint32_t fieldNumber) {
    appendTag(fieldNumber, kWireTypeVarint);
    appendVarint(static_cast<std::uint64_t>(static_cast<std::int64_t>(value)));
}

void Writer::writeData(std::string_view bytes, std::uint32_t fieldNumber) {
    appendTag(fieldNumber, kWireTypeLengthDelimited);
    appendVarint(bytes.size());
    data_.append(bytes);
}

// --- Reader -----------------------------------------------------------------------------------

std::uint64_t Reader::readVarint() {
    if (error_) {
        return 0;
    }
    std::uint64_t value = 0;
    for (int i = 0; i < kMaxVarintBytes; ++i) {
        if (position_ >= data_.size()) {
            error_ = true;
            return 0;
        }
        const auto byte = static_cast<std::uint8_t>(data_[position_++]);
        // The tenth byte brings bit 63; its higher bits fall off the end.
        value |= std::uint64_t{byte & 0x7fu} << (7 * i);
        if ((byte & 0x80) == 0) {
            return value;
        }
    }
    return 0;  // longer than ten bytes: no value, and reading goes on after the tenth
}

std::string Reader::readData() {
    const std::uint64_t length = readVarint();
    if (error_) {
        return {};
    }
    if (length > data_.size() - position_) {
        error_ = true;
        return {};
    }
    std::string bytes(data_.substr(position_, static_cast<std::size_t>(length)));
    position_ += static_cast<std::size_t>(length);
    return bytes;
}

bool Reader::skipBytes(std::uint64_t count) {
    if (error_ || count > data_.size() - position_) {
        error_ = true;
        return false;
    }
    position_ += static_cast<std::size_t>(count);
    return true;
}

bool Reader::skipField(std::uint64_t fieldNumber, std::uint32_t wireType) {
    return skipFieldAtDepth(fieldNumber, wireType, 0);
}

bool Reader::skipFieldAtDepth(std::uint64_t fieldNumber, std::uint32_t wireType, int depth) {
    if (error_) {
        return false;
    }
    switch (wireType) {
        case kWireTypeVarint:
            readVarint();
            return !error_;
        case kWireTypeFixed64:
            return skipBytes(8);
        case kWireTypeLengthDelimited: {
            const std::uint64_t length = readVarint();
            return !error_ && skipBytes(length);
        }
        case kWireTypeStartGroup:
            return skipGroup(fieldNumber, depth + 1);
        case kWireTypeFixed32:
            return skipBytes(4);
        default:  // an end group that no group opened, and wire types 6 and 7
            error_ = true;
            return false;
    }
}

bool Reader::skipGroup(std::uint64_t fieldNumber, int depth) {
    // Bounded, so that a run of start-group tags cannot exhaust the stack.
    if (depth > kMaxGroupDepth) {
        error_ = true;
        return false;
    }
    for (;;) {
        if (atEnd()) {
            error_ = true;  // the group never ends
            return false;
        }
        const std::uint64_t tag = readVarint();
        if (error_) {
            return false;
        }
        const auto wireType = static_cast<std::uint32_t>(tag & 7);
        const std::uint64_t innerField = tag >> 3;
        if (wireType == kWireTypeEndGroup) {
            if (innerField != fieldNumber) {
                error_ = true;
                return false;
            }
            return true;
        }
        if (!skipFieldAtDepth(innerField, wireType, depth)) {
            return false;
        }
    }
}

// --- LineTextFormatter ------------------------------------------------------------------------

void LineTextFormatter::beginValue(const char* name) {
    if (!text_.empty() && text_.back() != ' ') {
        text_ += ' ';
    }
    text_ += name;
}

void LineTextFormatter::beginObject(const char* name) {
    beginValue(name);
    text_ += " { ";
}

void LineTextFormatter::formatInt32(const char* name, std::int32_t value) {
    beginValue(name);
    text_ += ": ";
    appendDecimal(text_, value);
}

void LineTextFormatter::formatUInt64(const char* name, std::uint64_t value) {
    beginValue(name);
    text_ += ": ";
    appendDecimal(text_, value);
}

void LineTextFormatter::formatString(const char* name, std::string_view bytes) {
    beginValue(name);
    text_ += ": ";
    appendEscaped(text_, bytes);
}

void LineTextFormatter::endObject() {
    if (!text_.empty() && text_.back() != ' ') {
        text_ += ' ';
    }
    text_ += '}';
}

}  // namespace mtxmetrics

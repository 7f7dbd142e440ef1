#include "service/QVReportingDBusWireReader.h"

#include "service/QVReportingDBusWireText.h"
#include "values/Utf8.h"

#include <fmt/format.h>

#include <cstring>
#include <limits>
#include <string_view>
#include <type_traits>

namespace qv {

namespace {

constexpr std::size_t kMaxArrayBytes = std::size_t{1} << 26;  // D-Bus's bound on one array
constexpr int kMaxContainerNesting = 64;                      // in a message, variants included
constexpr std::uint8_t kSignatureField = 8;

// Fixed-size reads at D-Bus alignment; the body starts 8-aligned in its message, so offsets in
// the body align as they do in the message.
class Cursor {
  public:
    Cursor(std::span<const std::uint8_t> bytes, bool bigEndian)
        : bytes_(bytes), bigEndian_(bigEndian) {}

    std::size_t pos = 0;

    bool align(std::size_t to) {
        const std::size_t next = (pos + to - 1) / to * to;
        if (next > bytes_.size()) {
            return false;
        }
        pos = next;
        return true;
    }
    template <typename T>
    bool fixed(T& out) {
        if (!align(sizeof(T)) || bytes_.size() - pos < sizeof(T)) {
            return false;
        }
        std::uint64_t v = 0;
        for (std::size_t i = 0; i < sizeof(T); ++i) {
            const std::size_t at = bigEndian_ ? i : sizeof(T) - 1 - i;
            v = (v << 8) | bytes_[pos + at];
        }
        pos += sizeof(T);
        if constexpr (sizeof(T) == 8) {
            std::memcpy(&out, &v, 8);
        } else {
            out = static_cast<T>(v);
        }
        return true;
    }
    // A string of length bytes and its terminating NUL; false when the input ends first.
    bool text(std::size_t length, std::string_view& out) {
        if (bytes_.size() - pos <= length || bytes_[pos + length] != 0) {
            return false;
        }
        out = std::string_view(reinterpret_cast<const char*>(bytes_.data() + pos), length);
        pos += length + 1;
        return true;
    }
    bool string(std::string_view& out) {
        std::uint32_t length = 0;
        return fixed(length) && text(length, out);
    }
    bool signature(std::string_view& out) {
        std::uint8_t length = 0;
        return fixed(length) && text(length, out);
    }
    std::size_t size() const { return bytes_.size(); }

  private:
    std::span<const std::uint8_t> bytes_;
    bool bigEndian_;
};

// QVReportingReadDictionary's reader, over bytes: its structure and its charges are the codec's.
class Reader : public QVReportingPayloadMeter {
  public:
    Reader(Cursor& in, const QVReportingInputBudget& budget)
        : QVReportingPayloadMeter(budget), in_(in) {}

    bool readDictionary(std::string_view entrySignature, std::size_t depth, Value& out,
                        bool isTopLevel);
    bool read(std::string_view type, std::size_t depth, Value& out);

    Dictionary topLevel;

  private:
    bool malformed(std::string_view what) {
        error = QVReportingError::invalidArgs(
            !inKey_       ? fmt::format("the value under \"{}\" {}", key, what)
            : key.empty() ? fmt::format("the payload's first key {}", what)
                          : fmt::format("the payload's key after \"{}\" {}", key, what));
        return false;
    }
    bool truncated() { return malformed("runs past the end of the message"); }
    // Containers open around the value being read, against the bus's bound.
    bool enter() {
        return ++open_ <= kMaxContainerNesting || malformed("nests deeper than D-Bus allows");
    }
    template <typename T>
    bool readFixed(Value& out, std::size_t cost) {
        T v{};
        if (!in_.fixed(v)) {
            return truncated();
        }
        out = QVReportingDBusScalarValue(v);
        return charge(cost);
    }
    bool readString(char type, std::string& out);
    bool readArray(std::string_view contents, std::size_t depth, Value& out);
    bool readStruct(std::string_view contents, std::size_t depth, Value& out);
    // The array's length and the padding before its first item; sets end.
    bool openArray(std::size_t itemAlignment, std::size_t& end);

    Cursor& in_;
    int open_ = 0;
    bool inKey_ = false;
};

std::size_t alignmentOf(char type) {
    switch (type) {
        case 'y':
        case 'g':
        case 'v':
            return 1;
        case 'n':
        case 'q':
            return 2;
        case 'x':
        case 't':
        case 'd':
        case '(':
        case '{':
            return 8;
        default:
            return 4;
    }
}

bool Reader::readString(char type, std::string& out) {
    std::string_view text;
    if (!(type == 'g' ? in_.signature(text) : in_.string(text))) {
        return truncated();
    }
    if (text.find('\0') != std::string_view::npos) {
        return malformed("holds a string with a NUL byte");
    }
    if (type == 's' && !QVReportingIsValidUtf8(text)) {
        return malformed("holds a string that is not valid UTF-8");
    }
    if (type == 'o' && !dbuswire::isValidObjectPath(text)) {
        return malformed("holds an invalid object path");
    }
    if (type == 'g' && !dbuswire::isValidSignature(text)) {
        return malformed("holds an invalid signature");
    }
    out.assign(text);
    return true;
}

bool Reader::openArray(std::size_t itemAlignment, std::size_t& end) {
    std::uint32_t length = 0;
    if (!in_.fixed(length) || !in_.align(itemAlignment)) {
        return truncated();
    }
    if (length > kMaxArrayBytes) {
        return malformed("holds an array longer than D-Bus allows");
    }
    if (in_.size() - in_.pos < length) {
        return truncated();
    }
    end = in_.pos + length;
    return true;
}

bool Reader::read(std::string_view type, std::size_t depth, Value& out) {
    // A variant only wraps a value; what it holds is counted instead.
    if (type[0] != 'v' && !countValue()) {
        return false;
    }
    switch (type[0]) {
        case 'b': {
            std::uint32_t v = 0;
            if (!in_.fixed(v)) {
                return truncated();
            }
            out = v != 0;
            return charge(4);
        }
        case 'y':
            return readFixed<std::uint8_t>(out, 1);
        case 'n':
            return readFixed<std::int16_t>(out, 2);
        case 'q':
            return readFixed<std::uint16_t>(out, 2);
        case 'i':
            return readFixed<std::int32_t>(out, 4);
        case 'u':
            return readFixed<std::uint32_t>(out, 4);
        case 'x':
            return readFixed<std::int64_t>(out, 8);
        case 't':
            return readFixed<std::uint64_t>(out, 8);
        case 'd':
            return readFixed<double>(out, 8);
        case 's':
        case 'o':
        case 'g': {
            std::string text;
            if (!readString(type[0], text)) {
                return false;
            }
            const std::size_t size = text.size();
            out = std::move(text);
            return charge(size + 5);
        }
        case 'v': {
            std::string_view contents;
            if (!in_.signature(contents)) {
                return truncated();
            }
            if (dbuswire::completeTypeLength(contents) != contents.size() || contents.empty()) {
                return malformed("holds a variant whose signature is not one type");
            }
            if (!enter() || !charge(contents.size() + 2) || !read(contents, depth, out)) {
                return false;
            }
            --open_;
            return true;
        }
        case 'a':
            return readArray(type.substr(1), depth + 1, out);
        case '(':
            return readStruct(type.substr(1, type.size() - 2), depth + 1, out);
        case 'h':
            error = QVReportingError::invalidArgs(fmt::format(
                "the value under \"{}\" is a unix fd, which a payload cannot hold", key));
            return false;
        default:
            error = QVReportingError::invalidArgs(
                fmt::format("the value under \"{}\" has a type a payload cannot hold", key));
            return false;
    }
}

bool Reader::readArray(std::string_view contents, std::size_t depth, Value& out) {
    if (!enterDepth(depth)) {
        return false;
    }
    if (!charge(4)) {
        return false;
    }
    if (contents[0] == '{') {
        return readDictionary(contents.substr(1, contents.size() - 2), depth, out, false);
    }
    std::size_t end = 0;
    if (!enter() || !openArray(alignmentOf(contents[0]), end)) {
        return false;
    }
    if (contents == "y") {
        const std::size_t count = end - in_.pos;
        Bytes bytes(count);
        for (std::size_t i = 0; i < count; ++i) {
            std::uint8_t b = 0;
            in_.fixed(b);
            bytes[i] = b;
        }
        out = std::move(bytes);
        --open_;
        return charge(count);
    }
    Array items;
    while (in_.pos < end) {
        Value v;
        if (!read(contents, depth, v)) {
            return false;
        }
        items.push_back(std::move(v));
    }
    if (in_.pos != end) {
        return malformed("holds an array whose items overrun it");
    }
    --open_;
    out = std::move(items);
    return true;
}

bool Reader::readStruct(std::string_view contents, std::size_t depth, Value& out) {
    if (!enterDepth(depth)) {
        return false;
    }
    if (!enter()) {
        return false;
    }
    if (!in_.align(8)) {
        return truncated();
    }
    Array items;
    while (!contents.empty()) {
        const std::size_t n = dbuswire::completeTypeLength(contents);
        Value v;
        if (!read(contents.substr(0, n), depth, v)) {
            return false;
        }
        items.push_back(std::move(v));
        contents.remove_prefix(n);
    }
    --open_;
    out = std::move(items);
    return true;
}

bool Reader::readDictionary(std::string_view entrySignature, std::size_t depth, Value& out,
                            bool isTopLevel) {
    std::size_t end = 0;
    if (!enter() || !openArray(8, end)) {
        return false;
    }
    const bool stringKeys = entrySignature[0] == 's';
    // Entries with keys of another type become [key, value] pairs: a value each, one level down.
    const std::size_t entryDepth = stringKeys ? depth : depth + 1;
    if (!stringKeys && !enterDepth(entryDepth)) {
        return false;
    }
    const std::string_view keyType = entrySignature.substr(0, 1);
    const std::string_view valueType = entrySignature.substr(1);
    Dictionary dict;
    Array pairs;
    while (in_.pos < end) {
        if (!in_.align(8)) {
            return truncated();
        }
        if (!enter()) {
            return false;
        }
        Value k, v;
        std::string name;
        if (stringKeys) {
            inKey_ = isTopLevel;
            if (!readString('s', name)) {
                return false;
            }
            inKey_ = false;
            if (isTopLevel) {
                key.assign(name);
            }
            if (!charge(name.size() + 5)) {
                return false;
            }
        } else if (!countValue() || !read(keyType, entryDepth, k)) {
            return false;
        }
        if (!read(valueType, entryDepth, v)) {
            return false;
        }
        --open_;
        if (stringKeys) {
            dict.set(DictionaryKey(name), std::move(v));
        } else {
            pairs.push_back(Array{std::move(k), std::move(v)});
        }
    }
    if (in_.pos != end) {
        return malformed("holds a dictionary whose entries overrun it");
    }
    --open_;
    if (isTopLevel) {
        topLevel = std::move(dict);
    } else if (stringKeys) {
        out = std::move(dict);
    } else {
        out = std::move(pairs);
    }
    return true;
}

}  // namespace

std::optional<QVReportingDBusWireReader::Message> QVReportingDBusWireReader::split(
    std::span<const std::uint8_t> bytes) {
    if (bytes.size() < 16 || (bytes[0] != 'l' && bytes[0] != 'B') || bytes[3] != 1) {
        return std::nullopt;
    }
    Message message;
    message.bigEndian = bytes[0] == 'B';
    Cursor in(bytes, message.bigEndian);
    std::uint32_t bodyLength = 0, serial = 0, fieldsLength = 0;
    in.pos = 4;
    in.fixed(bodyLength);
    in.fixed(serial);
    in.fixed(fieldsLength);
    if (fieldsLength > bytes.size() - in.pos) {
        return std::nullopt;
    }
    const std::size_t fieldsEnd = in.pos + fieldsLength;
    while (in.pos < fieldsEnd) {
        std::uint8_t code = 0;
        std::string_view type, text;
        if (!in.align(8) || !in.fixed(code) || !in.signature(type) || type.size() != 1) {
            return std::nullopt;
        }
        std::uint32_t number = 0;
        const bool read = type[0] == 'g'   ? in.signature(text)
                          : type[0] == 'u' ? in.fixed(number)
                                           : (type[0] == 's' || type[0] == 'o') && in.string(text);
        if (!read) {
            return std::nullopt;
        }
        if (code == kSignatureField) {
            if (type[0] != 'g' || !dbuswire::isValidSignature(text)) {
                return std::nullopt;
            }
            message.signature.assign(text);
        }
    }
    if (in.pos != fieldsEnd || !in.align(8) || bytes.size() - in.pos < bodyLength) {
        return std::nullopt;
    }
    message.body = bytes.subspan(in.pos, bodyLength);
    return message;
}

QVReportingDecodeResult QVReportingDBusWireReader::readArguments(
    const Message& message, const QVReportingInputBudget& budget) {
    QVReportingDecodeResult result;
    std::string_view signature = message.signature;
    if (!signature.starts_with("a{sv}")) {
        result.error = QVReportingError::invalidArgs("the payload is not an a{sv}");
        return result;
    }
    Cursor in(message.body, message.bigEndian);
    Reader reader(in, budget);
    Value unused;
    const bool read = reader.readDictionary("sv", 1, unused, true);
    result.bytes = reader.bytes();
    if (!read) {
        result.error = std::move(reader.error);
        result.limit = reader.limit;
        return result;
    }
    result.dictionary = std::move(reader.topLevel);

    // The call's other arguments are not the payload: no budget of its own applies to them.
    constexpr std::size_t kNone = std::numeric_limits<std::size_t>::max();
    const QVReportingInputBudget unbounded{kNone, kNone, kNone};
    Reader rest(in, unbounded);
    result.rest.emplace();
    for (signature.remove_prefix(5); !signature.empty();) {
        const std::size_t n = dbuswire::completeTypeLength(signature);
        Value v;
        if (!rest.read(signature.substr(0, n), 0, v)) {
            result.error = std::move(rest.error);
            result.dictionary = {};
            result.rest.reset();
            return result;
        }
        result.rest->push_back(std::move(v));
        signature.remove_prefix(n);
    }
    return result;
}

}  // namespace qv

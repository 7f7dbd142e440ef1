#include "service/QVReportingDBusCodec.h"

#include <fmt/format.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cstring>

#include "service/QVReportingDBusMessageBytes.h"
#include "service/QVReportingDBusWireReader.h"

namespace qv {

namespace {

// Reads values one complete type at a time, keeping count of what the input costs. The first
// failure of sd-bus ends the read: its errno is kept in failed.
class Reader : public QVReportingPayloadMeter {
  public:
    Reader(sd_bus_message* message, const QVReportingInputBudget& budget)
        : QVReportingPayloadMeter(budget), m_(message) {}

    bool readDictionary(const char* entrySignature, std::size_t depth, Value& out, bool topLevel);
    bool read(std::size_t depth, Value& out);

    Dictionary topLevel;
    int failed = 0;              // sd-bus's errno, once a call of it failed
    bool stringRefused = false;  // sd-bus would not read a string (a key's or a value's)

  private:
    bool ok(int r) {
        if (r < 0) {
            failed = r;
            return false;
        }
        return true;
    }
    // 1 at the end of the current container, 0 before a value, -1 (failed set) on error.
    int atEnd(char& type, const char*& contents) {
        const int r = sd_bus_message_peek_type(m_, &type, &contents);
        return r < 0 ? (ok(r), -1) : r == 0 ? 1 : 0;
    }
    template <typename T>
    bool readScalar(char type, Value& out, std::size_t cost) {
        T v{};
        if (!ok(sd_bus_message_read_basic(m_, type, &v))) {
            return false;
        }
        out = QVReportingDBusScalarValue(v);
        return charge(cost);
    }
    // sd-bus refuses strings D-Bus allows (noncharacters): noted for a second reading.
    bool readText(char type, const char*& out) {
        const int r = sd_bus_message_read_basic(m_, type, &out);
        if (r < 0) {
            stringRefused = true;
        }
        return ok(r);
    }
    bool enter(char type, const char* contents) {
        return ok(sd_bus_message_enter_container(m_, type, contents));
    }
    bool exit() { return ok(sd_bus_message_exit_container(m_)); }
    bool readArray(const char* contents, std::size_t depth, Value& out);
    bool readStruct(const char* contents, std::size_t depth, Value& out);
    bool readItems(std::size_t depth, Array& items);

    sd_bus_message* m_;
};

bool Reader::read(std::size_t depth, Value& out) {
    char type = 0;
    const char* contents = nullptr;
    if (atEnd(type, contents) != 0) {
        return false;
    }
    // A variant only wraps a value; what it holds is counted instead.
    if (type != 'v' && !countValue()) {
        return false;
    }
    switch (type) {
        case 'b': {
            int b = 0;
            if (!ok(sd_bus_message_read_basic(m_, 'b', &b))) {
                return false;
            }
            out = b != 0;
            return charge(4);
        }
        case 'y':
            return readScalar<std::uint8_t>(type, out, 1);
        case 'n':
            return readScalar<std::int16_t>(type, out, 2);
        case 'q':
            return readScalar<std::uint16_t>(type, out, 2);
        case 'i':
            return readScalar<std::int32_t>(type, out, 4);
        case 'u':
            return readScalar<std::uint32_t>(type, out, 4);
        case 'x':
            return readScalar<std::int64_t>(type, out, 8);
        case 't':
            return readScalar<std::uint64_t>(type, out, 8);
        case 'd':
            return readScalar<double>(type, out, 8);
        case 's':
        case 'o':
        case 'g': {
            const char* text = nullptr;
            if (!readText(type, text)) {
                return false;
            }
            const std::size_t size = std::strlen(text);
            out = std::string(text, size);
            return charge(size + 5);
        }
        case 'v': {
            const std::size_t signatureSize = std::strlen(contents);
            if (!enter('v', contents) || !charge(signatureSize + 2) || !read(depth, out)) {
                return false;
            }
            return exit();
        }
        case 'a':
            return readArray(contents, depth + 1, out);
        case 'r':
            return readStruct(contents, depth + 1, out);
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

bool Reader::readItems(std::size_t depth, Array& items) {
    char type = 0;
    const char* inner = nullptr;
    for (int end; (end = atEnd(type, inner)) == 0;) {
        Value v;
        if (!read(depth, v)) {
            return false;
        }
        items.push_back(std::move(v));
    }
    return failed == 0;
}

bool Reader::readArray(const char* contents, std::size_t depth, Value& out) {
    if (!enterDepth(depth)) {
        return false;
    }
    if (!charge(4)) {
        return false;
    }
    if (contents[0] == '{') {
        const std::string entry(contents + 1, std::strlen(contents) - 2);
        return readDictionary(entry.c_str(), depth, out, false);
    }
    if (std::strcmp(contents, "y") == 0) {
        // Bytes come as one block, charged as the wire reader charges them.
        const void* data = nullptr;
        std::size_t size = 0;
        if (!ok(sd_bus_message_read_array(m_, 'y', &data, &size)) || !charge(size)) {
            return false;
        }
        const auto* begin = static_cast<const std::uint8_t*>(data);
        out = Bytes(begin, begin + size);
        return true;
    }
    Array items;
    if (!enter('a', contents) || !readItems(depth, items) || !exit()) {
        return false;
    }
    out = std::move(items);
    return true;
}

bool Reader::readStruct(const char* contents, std::size_t depth, Value& out) {
    if (!enterDepth(depth)) {
        return false;
    }
    Array items;
    if (!enter('r', contents) || !readItems(depth, items) || !exit()) {
        return false;
    }
    out = std::move(items);
    return true;
}

bool Reader::readDictionary(const char* entrySignature, std::size_t depth, Value& out,
                            bool isTopLevel) {
    const std::string arrayContents = std::string("{") + entrySignature + '}';
    if (!enter('a', arrayContents.c_str())) {
        return false;
    }
    const bool stringKeys = entrySignature[0] == 's';
    // Entries with keys of another type become [key, value] pairs: a value each, one level down.
    const std::size_t entryDepth = stringKeys ? depth : depth + 1;
    if (!stringKeys && !enterDepth(entryDepth)) {
        return false;
    }
    Dictionary dict;
    // A client's payloads tend to repeat their size: the top level starts with room for as many
    // entries as this thread's last one had, so its entries are not moved as it grows.
    thread_local std::size_t lastTopLevelSize = 0;
    if (isTopLevel) {
        dict.reserve(lastTopLevelSize);
    }
    Array pairs;
    char type = 0;
    const char* inner = nullptr;
    for (int end; (end = atEnd(type, inner)) == 0;) {
        if (!enter('e', entrySignature)) {
            return false;
        }
        Value k, v;
        const char* name = nullptr;
        std::size_t nameSize = 0;
        if (stringKeys) {
            if (!readText('s', name)) {
                return false;
            }
            nameSize = std::strlen(name);
            if (isTopLevel) {
                key.assign(name, nameSize);  // named in errors; its buffer is reused
            }
            if (!charge(nameSize + 5)) {
                return false;
            }
        } else if (!countValue() || !read(entryDepth, k)) {
            return false;
        }
        if (!read(entryDepth, v) || !exit()) {
            return false;
        }
        if (stringKeys) {
            // By key, not text: finding a repeated key then compares pointers, not bytes.
            dict.set(DictionaryKey(std::string_view(name, nameSize)), std::move(v));
        } else {
            pairs.push_back(Array{std::move(k), std::move(v)});
        }
    }
    if (failed != 0 || !exit()) {
        return false;
    }
    if (isTopLevel) {
        constexpr std::size_t kMaxReserved = 256;
        lastTopLevelSize = std::min(dict.size(), kMaxReserved);
        dict.reserveMore(0);  // gives back what a smaller payload left unused
        topLevel = std::move(dict);
    } else if (stringKeys) {
        out = std::move(dict);
    } else {
        out = std::move(pairs);
    }
    return true;
}

std::string signatureOf(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Bool:
            return "b";
        case Value::Kind::Int:
            return "x";
        case Value::Kind::UInt:
            return "t";
        case Value::Kind::Double:
        case Value::Kind::Date:
            return "d";
        case Value::Kind::String:
            return "s";
        case Value::Kind::Bytes:
            return "ay";
        case Value::Kind::Dictionary:
            return "a{sv}";
        case Value::Kind::Null:  // D-Bus has no null: an empty array stands for it
        case Value::Kind::Array:
            return "av";
    }
    return "av";
}

// The whole call read again from its bytes; nothing when they cannot be had.
std::optional<QVReportingDecodeResult> readFromBytes(sd_bus_message* message,
                                                     const QVReportingInputBudget& budget) {
    const auto bytes = QVReportingDBusMessageBytes::forThisThread().of(message);
    const auto wire = bytes ? QVReportingDBusWireReader::split(*bytes) : std::nullopt;
    if (!wire) {
        return std::nullopt;
    }
    return QVReportingDBusWireReader::readArguments(*wire, budget);
}

const Value& restAt(const QVReportingDecodeResult& decoded, std::size_t i) {
    static const Value kMissing;
    return i < decoded.rest->size() ? (*decoded.rest)[i] : kMissing;
}

}  // namespace

QVReportingDecodeResult QVReportingReadDictionary(sd_bus_message* message,
                                                  const QVReportingInputBudget& budget) {
    QVReportingDecodeResult result;
    Reader reader(message, budget);
    Value unused;
    if (!reader.readDictionary("sv", 1, unused, true) && !reader.error) {
        if (reader.stringRefused) {
            if (auto again = readFromBytes(message, budget)) {
                return std::move(*again);
            }
        }
        const std::string why =
            reader.failed ? std::strerror(-reader.failed) : "the payload ended early";
        reader.error = QVReportingError::invalidArgs(
            reader.key.empty()
                ? why
                : fmt::format("the value under \"{}\" cannot be read: {}", reader.key, why));
    }
    result.error = std::move(reader.error);
    result.limit = reader.limit;
    result.bytes = reader.bytes();
    if (!result.error) {
        result.dictionary = std::move(reader.topLevel);
    }
    return result;
}

bool QVReportingReadRest(sd_bus_message* message, const QVReportingDecodeResult& decoded,
                         std::int64_t& reporterID) {
    if (!decoded.rest) {
        return sd_bus_message_read_basic(message, 'x', &reporterID) > 0;
    }
    reporterID = restAt(decoded, 0).asInt64().value_or(0);
    return true;
}

bool QVReportingReadRest(sd_bus_message* message, const QVReportingDecodeResult& decoded,
                         std::uint32_t& category, std::uint16_t& type,
                         std::vector<std::int64_t>& reporterIDs) {
    reporterIDs.clear();
    if (!decoded.rest) {
        const void* ids = nullptr;
        std::size_t size = 0;
        if (sd_bus_message_read(message, "uq", &category, &type) <= 0 ||
            sd_bus_message_read_array(message, 'x', &ids, &size) < 0) {
            return false;
        }
        const auto* begin = static_cast<const std::int64_t*>(ids);
        reporterIDs.assign(begin, begin + size / sizeof(std::int64_t));
        return true;
    }
    // The wire reader gives unsigned integers that fit as signed ones, as the codec does.
    category = static_cast<std::uint32_t>(restAt(decoded, 0).asInt64().value_or(0));
    type = static_cast<std::uint16_t>(restAt(decoded, 1).asInt64().value_or(0));
    if (const Array* ids = restAt(decoded, 2).asArray()) {
        for (const Value& id : *ids) {
            reporterIDs.push_back(id.asInt64().value_or(0));
        }
    }
    return true;
}

int QVReportingAppendVariant(sd_bus_message* message, const Value& value) {
    const std::string signature = signatureOf(value);
    int r = sd_bus_message_open_container(message, 'v', signature.c_str());
    if (r < 0) {
        return r;
    }
    switch (value.kind()) {
        case Value::Kind::Bool: {
            const int b = value.boolValue() ? 1 : 0;
            r = sd_bus_message_append_basic(message, 'b', &b);
            break;
        }
        case Value::Kind::Int: {
            const std::int64_t v = *value.asInt64();
            r = sd_bus_message_append_basic(message, 'x', &v);
            break;
        }
        case Value::Kind::UInt: {
            const std::uint64_t v = *value.asUInt64();
            r = sd_bus_message_append_basic(message, 't', &v);
            break;
        }
        case Value::Kind::Double:
        case Value::Kind::Date: {
            const double v = value.kind() == Value::Kind::Date ? value.asDate()->secondsSince1970
                                                               : *value.asDouble();
            r = sd_bus_message_append_basic(message, 'd', &v);
            break;
        }
        case Value::Kind::String:
            r = sd_bus_message_append_basic(message, 's', value.asString()->c_str());
            break;
        case Value::Kind::Bytes: {
            const Bytes& bytes = *value.asBytes();
            r = sd_bus_message_append_array(message, 'y', bytes.data(), bytes.size());
            break;
        }
        case Value::Kind::Dictionary:
            r = QVReportingAppendDictionary(message, *value.asDictionary());
            break;
        case Value::Kind::Array:
            r = sd_bus_message_open_container(message, 'a', "v");
            for (const Value& v : *value.asArray()) {
                if (r >= 0) {
                    r = QVReportingAppendVariant(message, v);
                }
            }
            if (r >= 0) {
                r = sd_bus_message_close_container(message);
            }
            break;
        case Value::Kind::Null:
            r = sd_bus_message_open_container(message, 'a', "v");
            if (r >= 0) {
                r = sd_bus_message_close_container(message);
            }
            break;
    }
    return r < 0 ? r : sd_bus_message_close_container(message);
}

int QVReportingAppendDictionary(sd_bus_message* message, const Dictionary& dictionary) {
    int r = sd_bus_message_open_container(message, 'a', "{sv}");
    for (const auto& [key, value] : dictionary) {
        if (r < 0) {
            return r;
        }
        r = sd_bus_message_open_container(message, 'e', "sv");
        if (r >= 0) {
            r = sd_bus_message_append_basic(message, 's', key.str().c_str());
        }
        if (r >= 0) {
            r = QVReportingAppendVariant(message, value);
        }
        if (r >= 0) {
            r = sd_bus_message_close_container(message);
        }
    }
    return r < 0 ? r : sd_bus_message_close_container(message);
}

}  // namespace qv

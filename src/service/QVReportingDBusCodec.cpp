#include "service/QVReportingDBusCodec.h"

#include <fmt/format.h>
#include <sdbus-c++/Error.h>
#include <sdbus-c++/Types.h>

#include "service/QVReportingDBusMessageBytes.h"
#include "service/QVReportingDBusWireReader.h"

namespace qv {

namespace {

// Reads values one complete type at a time, keeping count of what the input costs.
class Reader : public QVReportingPayloadMeter {
  public:
    Reader(sdbus::Message& message, const QVReportingInputBudget& budget)
        : QVReportingPayloadMeter(budget), m_(message) {}

    bool readDictionary(const std::string& entrySignature, std::size_t depth, Value& out,
                        bool topLevel);
    bool read(std::size_t depth, Value& out);

    Dictionary topLevel;
    bool stringRefused = false;  // sd-bus would not read a string (a key's or a value's)

  private:
    bool atEnd(std::string& type, std::string& contents) {
        m_.peekType(type, contents);
        return type.empty() || type[0] == '\0';
    }
    template <typename T>
    bool readScalar(Value& out) {
        T v{};
        m_ >> v;
        out = v;
        return charge(sizeof(T));
    }
    // sd-bus refuses strings D-Bus allows (noncharacters): noted for a second reading.
    template <typename T>
    void readText(T& out) {
        try {
            m_ >> out;
        } catch (const sdbus::Error&) {
            stringRefused = true;
            throw;
        }
    }
    template <typename T>
    bool readString(Value& out) {
        T v;
        readText(v);
        const std::size_t size = v.size();
        out = std::string(std::move(v));
        return charge(size + 5);
    }
    bool readArray(const std::string& contents, std::size_t depth, Value& out);
    bool readStruct(const std::string& contents, std::size_t depth, Value& out);

    sdbus::Message& m_;
};

bool Reader::read(std::size_t depth, Value& out) {
    std::string type, contents;
    if (atEnd(type, contents)) {
        return false;
    }
    // A variant only wraps a value; what it holds is counted instead.
    if (type[0] != 'v' && !countValue()) {
        return false;
    }
    switch (type[0]) {
        case 'b': {
            bool b = false;
            m_ >> b;
            out = b;
            return charge(4);
        }
        case 'y': {
            std::uint8_t v = 0;
            m_ >> v;
            out = std::int64_t{v};
            return charge(1);
        }
        case 'n':
            return readScalar<std::int16_t>(out);
        case 'q': {
            std::uint16_t v = 0;
            m_ >> v;
            out = std::int64_t{v};
            return charge(2);
        }
        case 'i':
            return readScalar<std::int32_t>(out);
        case 'u': {
            std::uint32_t v = 0;
            m_ >> v;
            out = std::int64_t{v};
            return charge(4);
        }
        case 'x':
            return readScalar<std::int64_t>(out);
        case 't':
            return readScalar<std::uint64_t>(out);
        case 'd':
            return readScalar<double>(out);
        case 's':
            return readString<std::string>(out);
        case 'o':
            return readString<sdbus::ObjectPath>(out);
        case 'g':
            return readString<sdbus::Signature>(out);
        case 'v': {
            m_.enterVariant(contents);
            if (!charge(contents.size() + 2) || !read(depth, out)) {
                return false;
            }
            m_.exitVariant();
            return true;
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

bool Reader::readArray(const std::string& contents, std::size_t depth, Value& out) {
    if (!enterDepth(depth)) {
        return false;
    }
    if (!charge(4)) {
        return false;
    }
    if (!contents.empty() && contents[0] == '{') {
        return readDictionary(contents.substr(1, contents.size() - 2), depth, out, false);
    }
    std::string type, inner;
    m_.enterContainer(contents);
    if (contents == "y") {
        Bytes bytes;
        while (!atEnd(type, inner)) {
            std::uint8_t b = 0;
            m_ >> b;
            bytes.push_back(b);
            if (!charge(1)) {
                return false;
            }
        }
        m_.exitContainer();
        out = std::move(bytes);
        return true;
    }
    Array items;
    while (!atEnd(type, inner)) {
        Value v;
        if (!read(depth, v)) {
            return false;
        }
        items.push_back(std::move(v));
    }
    m_.exitContainer();
    out = std::move(items);
    return true;
}

bool Reader::readStruct(const std::string& contents, std::size_t depth, Value& out) {
    if (!enterDepth(depth)) {
        return false;
    }
    m_.enterStruct(contents);
    Array items;
    std::string type, inner;
    while (!atEnd(type, inner)) {
        Value v;
        if (!read(depth, v)) {
            return false;
        }
        items.push_back(std::move(v));
    }
    m_.exitStruct();
    out = std::move(items);
    return true;
}

bool Reader::readDictionary(const std::string& entrySignature, std::size_t depth, Value& out,
                            bool isTopLevel) {
    m_.enterContainer("{" + entrySignature + "}");
    const bool stringKeys = !entrySignature.empty() && entrySignature[0] == 's';
    // Entries with keys of another type become [key, value] pairs: a value each, one level down.
    const std::size_t entryDepth = stringKeys ? depth : depth + 1;
    if (!stringKeys && !enterDepth(entryDepth)) {
        return false;
    }
    Dictionary dict;
    Array pairs;
    std::string type, inner;
    while (!atEnd(type, inner)) {
        m_.enterDictEntry(entrySignature);
        Value k, v;
        std::string name;
        if (stringKeys) {
            readText(name);
            if (isTopLevel) {
                key.assign(name);  // named in errors; its buffer is reused entry after entry
            }
            if (!charge(name.size() + 5)) {
                return false;
            }
        } else if (!countValue() || !read(entryDepth, k)) {
            return false;
        }
        if (!read(entryDepth, v)) {
            return false;
        }
        m_.exitDictEntry();
        if (stringKeys) {
            dict.set(std::move(name), std::move(v));
        } else {
            pairs.push_back(Array{std::move(k), std::move(v)});
        }
    }
    m_.exitContainer();
    if (isTopLevel) {
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
std::optional<QVReportingDecodeResult> readFromBytes(const sdbus::Message& message,
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

QVReportingDecodeResult QVReportingReadDictionary(sdbus::Message& message,
                                                  const QVReportingInputBudget& budget) {
    QVReportingDecodeResult result;
    Reader reader(message, budget);
    Value unused;
    try {
        if (!reader.readDictionary("sv", 1, unused, true) && !reader.error) {
            reader.error = QVReportingError::invalidArgs("the payload ended early");
        }
    } catch (const sdbus::Error& e) {
        if (reader.stringRefused) {
            if (auto again = readFromBytes(message, budget)) {
                return std::move(*again);
            }
        }
        reader.error = QVReportingError::invalidArgs(
            reader.key.empty() ? e.getMessage()
                               : fmt::format("the value under \"{}\" cannot be read: {}",
                                             reader.key, e.getMessage()));
    }
    result.error = std::move(reader.error);
    result.limit = reader.limit;
    result.bytes = reader.bytes();
    if (!result.error) {
        result.dictionary = std::move(reader.topLevel);
    }
    return result;
}

void QVReportingReadRest(sdbus::Message& message, const QVReportingDecodeResult& decoded,
                         std::int64_t& reporterID) {
    if (!decoded.rest) {
        message >> reporterID;
        return;
    }
    reporterID = restAt(decoded, 0).asInt64().value_or(0);
}

void QVReportingReadRest(sdbus::Message& message, const QVReportingDecodeResult& decoded,
                         std::uint32_t& category, std::uint16_t& type,
                         std::vector<std::int64_t>& reporterIDs) {
    if (!decoded.rest) {
        message >> category >> type >> reporterIDs;
        return;
    }
    // The wire reader gives unsigned integers that fit as signed ones, as the codec does.
    category = static_cast<std::uint32_t>(restAt(decoded, 0).asInt64().value_or(0));
    type = static_cast<std::uint16_t>(restAt(decoded, 1).asInt64().value_or(0));
    reporterIDs.clear();
    if (const Array* ids = restAt(decoded, 2).asArray()) {
        for (const Value& id : *ids) {
            reporterIDs.push_back(id.asInt64().value_or(0));
        }
    }
}

void QVReportingAppendVariant(sdbus::Message& message, const Value& value) {
    const std::string signature = signatureOf(value);
    message.openVariant(signature);
    switch (value.kind()) {
        case Value::Kind::Bool:
            message << value.boolValue();
            break;
        case Value::Kind::Int:
            message << *value.asInt64();
            break;
        case Value::Kind::UInt:
            message << *value.asUInt64();
            break;
        case Value::Kind::Double:
            message << *value.asDouble();
            break;
        case Value::Kind::Date:
            message << value.asDate()->secondsSince1970;
            break;
        case Value::Kind::String:
            message << *value.asString();
            break;
        case Value::Kind::Bytes:
            message.openContainer("y");
            for (std::uint8_t b : *value.asBytes()) {
                message << b;
            }
            message.closeContainer();
            break;
        case Value::Kind::Dictionary:
            QVReportingAppendDictionary(message, *value.asDictionary());
            break;
        case Value::Kind::Array:
            message.openContainer("v");
            for (const Value& v : *value.asArray()) {
                QVReportingAppendVariant(message, v);
            }
            message.closeContainer();
            break;
        case Value::Kind::Null:
            message.openContainer("v");
            message.closeContainer();
            break;
    }
    message.closeVariant();
}

void QVReportingAppendDictionary(sdbus::Message& message, const Dictionary& dictionary) {
    message.openContainer("{sv}");
    for (const auto& [key, value] : dictionary) {
        message.openDictEntry("sv");
        message << key.str();
        QVReportingAppendVariant(message, value);
        message.closeDictEntry();
    }
    message.closeContainer();
}

}  // namespace qv

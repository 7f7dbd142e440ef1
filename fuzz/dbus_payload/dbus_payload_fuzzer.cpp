// QVReportingReadDictionary on D-Bus messages built from the input. The input is a program: it
// picks the message's layout (a bare a{sv}, SendMessage's a{sv}uqax, or anything else), a budget,
// and then type codes and values, so that every D-Bus type reaches the reader: all the integer
// widths, doubles with any bits, strings, object paths, signatures, unix fds, variants inside
// variants, structs, arrays of bytes and of everything else, and dictionaries with keys of every
// basic type, nested as deep as the bus lets a message go (64 containers, variants included).
//
// Properties:
// - nothing escapes the reader, whatever the message;
// - without limits, it accepts exactly the messages that start with a{sv} and hold no unix fd;
// - under the budget, it accepts what the unlimited reader accepts, with the same result, or
//   refuses for a limit (LimitsExceeded) or for the same reason as the unlimited reader;
// - what it accepts keeps to the budget: no deeper than allowed, no more values;
// - what it accepts, written back with QVReportingAppendDictionary and read again with the same
//   depth and value limits, gives the same dictionary, kinds and key order included;
// - after an accepted payload the message stands at what follows it (SendMessage's arguments);
// - the wire reader (the codec's fallback for strings sd-bus refuses), given the message's bytes,
//   agrees with the sd-bus reader: the same dictionary when both accept, the same arguments after
//   it, and under the budget it accepts what the sd-bus reader accepts.
#include <fcntl.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <limits>
#include <optional>
#include <string>
#include <vector>

#include <sdbus-c++/Error.h>
#include <sdbus-c++/Message.h>
#include <sdbus-c++/Types.h>

#include "QVReportingDBusNames.h"
#include "common/DBusTypes.h"
#include "common/FuzzSupport.h"
#include "service/QVReportingDBusCodec.h"
#include "service/QVReportingDBusMessageBytes.h"
#include "service/QVReportingDBusWireReader.h"

// Exported by libsdbus-c++ 1.2 (variants are built on it) but declared in its public headers only
// by later versions: a message that belongs to no bus, which is all a reader needs.
namespace sdbus {
PlainMessage createPlainMessage();
}

namespace {

using qv::Dictionary;
using qv::QVReportingDecodeResult;
using qv::QVReportingInputBudget;
using qv::Value;
using qv::fuzz::check;
using qv::fuzz::FuzzInput;
using qv::fuzz::kMaxMessageNesting;
using qv::fuzz::libraryReads;
using qv::fuzz::makeBoundedType;
using qv::fuzz::nestingOf;
using qv::fuzz::RawMessage;
using qv::fuzz::signatureOf;
using qv::fuzz::Type;

// Writes values of fuzzed types into a message, keeping count of what it made.
class Builder {
  public:
    Builder(FuzzInput& in, sdbus::Message& m, int fd) : in_(in), m_(m), fd_(fd) {}

    // Values written inside the payload's own array and entry start two containers down.
    void setDepth(int depth) { depth_ = depth; }

    void value(const Type& type) {
        ++made_;
        switch (type.code) {
            case 'b':
                m_ << static_cast<bool>(in_.byte() & 1);
                return;
            case 'y':
                m_ << in_.byte();
                return;
            case 'n':
                m_ << static_cast<std::int16_t>(in_.u16());
                return;
            case 'q':
                m_ << in_.u16();
                return;
            case 'i':
                m_ << static_cast<std::int32_t>(in_.u32());
                return;
            case 'u':
                m_ << in_.u32();
                return;
            case 'x':
                m_ << static_cast<std::int64_t>(in_.u64());
                return;
            case 't':
                m_ << in_.u64();
                return;
            case 'd':
                m_ << in_.f64();
                return;
            case 's':
                m_ << qv::fuzz::validText(in_, 40);
                return;
            case 'o':
                m_ << sdbus::ObjectPath(objectPath());
                return;
            case 'g':
                m_ << sdbus::Signature(signatureOf(makeBoundedType(in_)));
                return;
            case 'h':
                hadFd = true;
                m_ << sdbus::UnixFd(fd_);
                return;
            case 'v': {
                // Variants may hold variants: the reader must not trust nesting it cannot see in
                // a signature. The chain ends where the bus would refuse the message.
                Type inner = makeBoundedType(in_);
                if (depth_ + 1 + nestingOf(inner) > kMaxMessageNesting) {
                    inner = {'x', {}};
                }
                ++depth_;
                m_.openVariant(signatureOf(inner));
                value(inner);
                m_.closeVariant();
                --depth_;
                return;
            }
            case '(': {
                std::string contents;
                for (const Type& item : type.items) {
                    contents += signatureOf(item);
                }
                ++depth_;
                m_.openStruct(contents);
                for (const Type& item : type.items) {
                    value(item);
                }
                m_.closeStruct();
                --depth_;
                return;
            }
            case 'a':
                array(type.items[0]);
                return;
            default:
                check(false);
        }
    }

    bool hadFd = false;

  private:
    // Short arrays mostly, now and then a long one; none once the message holds enough.
    std::size_t count(std::size_t longOne) {
        const std::uint8_t b = in_.byte();
        if (made_ > kMaxValues) {
            return 0;
        }
        return b < 240 ? b % 6 : (b - 240 + 1) * longOne / 16;
    }

    void array(const Type& item) {
        const std::string contents = signatureOf(item);
        ++depth_;
        m_.openContainer(contents);
        if (item.code == 'y') {
            for (std::size_t i = 0, n = count(4096); i < n; ++i) {
                m_ << static_cast<std::uint8_t>(in_.empty() ? i : in_.byte());
            }
        } else if (item.code == '{') {
            const std::string entry = contents.substr(1, contents.size() - 2);
            for (std::size_t i = 0, n = count(64); i < n; ++i) {
                ++depth_;
                m_.openDictEntry(entry);
                value(item.items[0]);
                value(item.items[1]);
                m_.closeDictEntry();
                --depth_;
            }
        } else {
            for (std::size_t i = 0, n = count(256); i < n; ++i) {
                value(item);
            }
        }
        m_.closeContainer();
        --depth_;
    }

    std::string objectPath() {
        std::string path;
        for (std::size_t i = 0, n = in_.byte() % 4; i < n; ++i) {
            path += '/';
            for (std::size_t j = 0, k = 1 + in_.byte() % 6; j < k; ++j) {
                static constexpr char kChars[] = "abcXYZ019_";
                path += kChars[in_.byte() % (sizeof kChars - 1)];
            }
        }
        return path.empty() ? "/" : path;
    }

    static constexpr std::size_t kMaxValues = 20000;

    FuzzInput& in_;
    sdbus::Message& m_;
    int fd_;
    std::size_t made_ = 0;
    int depth_ = 0;  // containers open around the value being written
};

struct Built {
    sdbus::PlainMessage message;
    bool startsWithPayload = false;  // the first argument is an a{sv}
    bool hadFd = false;
    bool anyFd = false;  // anywhere in the message: it cannot be sent on a connection without fds
    bool sendMessage = false;  // a{sv}uqax: the arguments after the payload
    std::uint32_t category = 0;
    std::uint16_t type = 0;
    std::vector<std::int64_t> ids;
};

// False when the bus refuses what the program asks for (too deep, say): not a reader's problem.
bool build(FuzzInput& in, int fd, Built& out) {
    out.message = sdbus::createPlainMessage();
    Builder builder(in, out.message, fd);
    const std::uint8_t layout = in.byte() % 4;
    try {
        if (layout <= 2) {
            out.startsWithPayload = true;
            out.message.openContainer("{sv}");
            builder.setDepth(2);
            for (std::size_t i = 0, n = in.byte() % 12; i < n; ++i) {
                out.message.openDictEntry("sv");
                // Few distinct keys, so that duplicates occur.
                out.message << ((in.byte() & 3) ? qv::fuzz::validText(in, 8)
                                                : std::string("k") + std::to_string(i % 3));
                builder.value({'v', {}});
                out.message.closeDictEntry();
            }
            out.message.closeContainer();
            builder.setDepth(0);
            if (layout == 2) {
                out.sendMessage = true;
                out.category = in.u32();
                out.type = in.u16();
                for (std::size_t i = 0, n = in.byte() % 5; i < n; ++i) {
                    out.ids.push_back(static_cast<std::int64_t>(in.u64()));
                }
                out.message << out.category << out.type << out.ids;
            }
        } else {
            // Anything at all: sometimes nothing, sometimes a{sv} by chance.
            for (std::size_t i = 0, n = in.byte() % 3; i < n; ++i) {
                const Type t = makeBoundedType(in);
                builder.value(t);
                if (i == 0) {
                    out.startsWithPayload = signatureOf(t) == "a{sv}";
                    out.hadFd = builder.hadFd;  // the reader reads the first argument only
                }
            }
        }
        out.message.seal();
    } catch (const sdbus::Error&) {
        return false;
    }
    if (layout <= 2) {
        out.hadFd = builder.hadFd;
    }
    out.anyFd = builder.hadFd;
    return true;
}

QVReportingDecodeResult decode(sdbus::Message& message, const QVReportingInputBudget& budget) {
    message.rewind(true);
    return qv::QVReportingReadDictionary(RawMessage::of(message), budget);
}

constexpr std::size_t kUnlimited = std::numeric_limits<std::size_t>::max();

QVReportingInputBudget budgetFrom(FuzzInput& in) {
    const std::uint8_t b = in.byte();
    const qv::QVReportingLimits defaults;
    QVReportingInputBudget budget{defaults.maxPayloadBytes, defaults.maxPayloadValues,
                                  defaults.maxPayloadDepth};
    if (b & 1) {
        budget.maxDepth = in.byte() % 20;
    }
    if (b & 2) {
        budget.maxValues = in.byte() % 64;
    }
    if (b & 4) {
        budget.maxBytes = in.u16() % 2048;
    }
    return budget;
}

// The message read from its bytes; nothing when it cannot be sent (it carries a unix fd).
std::optional<QVReportingDecodeResult> readWire(const sdbus::Message& message,
                                                const QVReportingInputBudget& budget) {
    const auto bytes = qv::QVReportingDBusMessageBytes::forThisThread().of(RawMessage::of(message));
    if (!bytes) {
        return std::nullopt;
    }
    const auto wire = qv::QVReportingDBusWireReader::split(*bytes);
    check(wire.has_value());
    return qv::QVReportingDBusWireReader::readArguments(*wire, budget);
}

int openNull() {
    static const int fd = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    return fd;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    FuzzInput in(data, size);
    const QVReportingInputBudget budget = budgetFrom(in);
    Built built;
    if (!build(in, openNull(), built)) {
        return -1;
    }

    const QVReportingDecodeResult free = decode(built.message, {kUnlimited, kUnlimited, 1000});
    const bool acceptable = built.startsWithPayload && !built.hadFd;
    if (acceptable && free.error && !libraryReads(built.message)) {
        return -1;
    }
    check(!free.error == acceptable);
    check(!free.limit);
    if (free.error) {
        check(free.error->name == qv::dbus::kErrorInvalidArgs && !free.error->message.empty());
    }

    const QVReportingDecodeResult bounded = decode(built.message, budget);
    if (bounded.error) {
        check(!bounded.error->message.empty());
        if (bounded.limit) {
            check(bounded.error->name == qv::dbus::kErrorLimitsExceeded);
        } else {
            // Not a limit: the reader met the same problem the unlimited one did.
            check(free.error && bounded.error->name == free.error->name &&
                  bounded.error->message == free.error->message);
        }
        check(bounded.dictionary.empty());
        return 0;
    }
    check(!free.error);
    check(qv::fuzz::sameDictionary(bounded.dictionary, free.dictionary));

    if (const auto wire = readWire(built.message, budget)) {
        check(!wire->error);
        check(qv::fuzz::sameDictionary(wire->dictionary, bounded.dictionary));
        check(wire->rest.has_value());
        if (built.sendMessage) {
            std::uint32_t category = 0;
            std::uint16_t type = 0;
            std::vector<std::int64_t> ids;
            check(
                qv::QVReportingReadRest(RawMessage::of(built.message), *wire, category, type, ids));
            check(category == built.category && type == built.type && ids == built.ids);
        }
    } else {
        check(built.anyFd);
    }

    // What was accepted keeps to the budget: the payload's values (the dictionary itself not
    // counted) and its nesting (the dictionary is the first level).
    const Value whole(bounded.dictionary);
    check(whole.depth() <= std::max<std::size_t>(budget.maxDepth, 1));
    check(whole.valueCount() - 1 <= budget.maxValues);

    if (built.sendMessage) {
        std::uint32_t category = 0;
        std::uint16_t type = 0;
        std::vector<std::int64_t> ids;
        built.message >> category >> type >> ids;
        check(category == built.category && type == built.type && ids == built.ids);
    }

    // Written back and read again (the daemon's own encoding may take more bytes than the
    // client's, never more values or depth).
    sdbus::PlainMessage again = sdbus::createPlainMessage();
    check(qv::QVReportingAppendDictionary(RawMessage::of(again), bounded.dictionary) >= 0);
    again.seal();
    const QVReportingDecodeResult reread =
        decode(again, {kUnlimited, budget.maxValues, budget.maxDepth});
    check(!reread.error);
    check(qv::fuzz::sameDictionary(reread.dictionary, bounded.dictionary));
    return 0;
}

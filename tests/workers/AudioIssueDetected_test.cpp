#include "workers/backends/mtx/AudioIssueDetected.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

namespace mtxmetrics {
namespace {

using namespace std::string_literals;

std::string wireOf(const AudioIssueDetected& record) {
    Writer writer;
    record.writeTo(writer);
    return writer.takeData();
}

// What protoc prints for bytes on its standard input: --decode_raw, or with the shipped schema.
std::string protoc(const std::string& bytes, bool withSchema) {
    char path[] = "/tmp/qv-mtx-record-XXXXXX";
    ::close(::mkstemp(path));
    std::ofstream(path, std::ios::binary) << bytes;
    const std::string command =
        withSchema ? "protoc --decode=mtxmetrics.AudioIssueDetected --proto_path=" QV_SOURCE_DIR
                     "/data audio_issue_detected.proto < "s +
                         path + " 2>&1"
                   : "protoc --decode_raw < "s + path + " 2>&1";
    std::string out;
    FILE* pipe = ::popen(command.c_str(), "r");
    if (pipe == nullptr) {
        ADD_FAILURE() << "cannot run " << command;
        return out;
    }
    for (char buffer[4096]; std::size_t n = std::fread(buffer, 1, sizeof buffer, pipe);) {
        out.append(buffer, n);
    }
    EXPECT_EQ(::pclose(pipe), 0) << command << ": " << out;
    std::filesystem::remove(path);
    return out;
}

std::pair<bool, AudioIssueDetected> read(const std::string& bytes) {
    Reader reader(bytes);
    AudioIssueDetected record;
    const bool ok = record.readFrom(reader);
    return {ok, record};
}

TEST(AnAudioIssueDetected, WritesWhatProtocReadsAndFormatsTextAsProtocPrintsIt) {
    // A negative duration is sign-extended to ten bytes; bytes that are not text are escaped.
    // (The worker's everyday record on the wire: its own test and the sink's end-to-end test.)
    AudioIssueDetected record;
    record.issuetype = "stall";
    record.node = "12";
    record.duration = -5;
    record.rtaidclient = "a\"b\\c\n\r\t'\x01\xc3\xa9\x7f"s;
    const std::string wire = wireOf(record);
    EXPECT_EQ(wire.substr(0, 11), "\x10\xfb\xff\xff\xff\xff\xff\xff\xff\xff\x01"s);
    // Without a timestamp, protoc's field order is the text's alphabetical one.
    std::string theirs = protoc(wire, true);
    std::replace(theirs.begin(), theirs.end(), '\n', ' ');
    LineTextFormatter text;
    record.formatText(text, "AudioIssueDetected");
    EXPECT_EQ(text.text(), "AudioIssueDetected { " + theirs + "}");

    record.setTimestamp(18446744073709551615u);
    EXPECT_EQ(protoc(wireOf(record), false),
              "1: 18446744073709551615\n2: 18446744073709551611\n3: \"stall\"\n4: \"12\"\n5: "
              "\"a\\\"b\\\\c\\n\\r\\t\\'\\001\\303\\251\\177\"\n");
    LineTextFormatter withTimestamp;
    record.formatText(withTimestamp, "r");
    EXPECT_TRUE(withTimestamp.text().ends_with("\" timestamp: 18446744073709551615 }"));
}

TEST(AnAudioIssueDetected, ReadsByFieldNumberAloneSkipsUnknownFieldsAndRefusesMalformedData) {
    struct Case {
        const char* what;
        std::string bytes;
        bool ok;
        std::int32_t duration;  // when ok
    };
    const std::string nine = "\x10\x09"s;  // read after what comes before it
    const std::vector<Case> cases = {
        {"no bytes", "", true, 0},
        {"a string field tagged as a varint", "\x18\x02hi"s + nine, true, 9},
        {"low 32 bits of a 64-bit varint", "\x10\xff\xff\xff\xff\x1f"s, true, -1},
        {"a repeated field, the last wins", "\x10\x01" + nine, true, 9},
        {"end group ends the read", "\x10\x01\x1c\x10\x02"s, true, 1},
        {"unknown varint", "\x30\xff\x7f"s + nine, true, 9},
        {"unknown fixed64", "\x31" + std::string(8, 'x') + nine, true, 9},
        {"unknown length-delimited",
         "\x32\x03"
         "abc"s +
             nine,
         true, 9},
        {"unknown fixed32", "\x35" + std::string(4, 'x') + nine, true, 9},
        {"field number 0", "\x00\x05"s + nine, true, 9},
        {"group, fields and a nested group", "\x3b\x08\x01\x43\x44\x12\x00\x3c"s + nine, true, 9},
        // Cut at ten bytes the tag is 0 (its value 0x01 skipped), not a tag of wire type 7.
        {"tag run over ten bytes", std::string(10, '\xff') + "\x01"s + nine, true, 9},
        {"value run over ten bytes", "\x10\x05\x10"s + std::string(10, '\x80'), true, 0},
        {"fixed64 cut short", "\x31" + std::string(7, 'x'), false, 0},
        {"fixed32 cut short", "\x35\x00\x00"s, false, 0},
        {"length beyond the data", "\x32\xff\xff\xff\xff\xff\xff\xff\xff\xff\x01"s, false, 0},
        {"wire type 6", "\x36\x00"s + nine, false, 0},
        {"wire type 7", "\x37\x00"s + nine, false, 0},
        {"group without its end", "\x3b\x08\x01"s, false, 0},
        {"group ended by another field", "\x3b\x08\x01\x44"s + nine, false, 0},
        {"tag cut short", "\x10\x01\x80"s, false, 0},
        {"known varint cut short", "\x10\xff"s, false, 0},
        {"known string cut short",
         "\x1a\x05"
         "ab"s,
         false, 0},
    };
    for (const auto& c : cases) {
        const auto [ok, record] = read(c.bytes);
        EXPECT_EQ(ok, c.ok) << c.what;
        if (c.ok) {
            EXPECT_EQ(record.duration, c.duration) << c.what;
        }
    }

    // Field 1 tagged as a string: its length byte is the timestamp and reading goes on after it.
    auto [ok, record] = read("\x0a\x03\x10\x07\x1a\x01x\x1a\x02yz"s);
    EXPECT_TRUE(ok && record.hasTimestamp());
    EXPECT_EQ(record.timestamp, 3u);
    EXPECT_EQ(record.duration, 7);
    EXPECT_EQ(record.issuetype, "yz");

    // Groups nest up to the reader's limit; one level more is refused.
    const auto nested = [](int depth) {
        return std::string(depth, '\x3b') + std::string(depth, '\x3c');
    };
    EXPECT_TRUE(read(nested(Reader::kMaxGroupDepth)).first);
    EXPECT_FALSE(read(nested(Reader::kMaxGroupDepth + 1)).first);
}

// The timestamp counts only with its presence bit, in equality, hashing and moves alike. (What a
// record reads back as, and that copies keep it equal, the mtx_record fuzz target checks.)
TEST(AnAudioIssueDetected, ComparesHashesAndMovesTheTimestampWithItsPresenceBit) {
    AudioIssueDetected a;
    a.issuetype = "t";
    AudioIssueDetected b = a;
    b.timestamp = 99;  // stored, but its presence bit is clear
    b.has = 0xfffffffe;
    EXPECT_EQ(a, b);
    EXPECT_EQ(a.hash_value(), b.hash_value());
    b.setTimestamp(99);
    EXPECT_NE(a, b);
    a.setTimestamp(98);
    EXPECT_NE(a, b);

    // Moving exchanges: the source ends up with what the target held, the mask included.
    AudioIssueDetected target;
    const AudioIssueDetected source = b;
    target = std::move(b);
    EXPECT_EQ(target, source);
    EXPECT_EQ(target.has, 0xffffffffu);
    EXPECT_EQ(b, AudioIssueDetected{});  // NOLINT(bugprone-use-after-move): moving exchanges
}

}  // namespace
}  // namespace mtxmetrics

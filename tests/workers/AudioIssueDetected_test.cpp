#include "workers/backends/mtx/AudioIssueDetected.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <array>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <random>
#include <string>
#include <unordered_set>
#include <vector>

namespace mtxmetrics {
namespace {

using namespace std::string_literals;

const std::filesystem::path kProtoFile =
    std::filesystem::path(QV_SOURCE_DIR) / "data" / "audio_issue_detected.proto";

std::string wireOf(const AudioIssueDetected& record) {
    Writer writer;
    record.writeTo(writer);
    return writer.takeData();
}

// What protoc prints for bytes on its standard input, with arguments such as --decode_raw.
std::string protoc(const std::string& bytes, const std::string& arguments) {
    char path[] = "/tmp/qv-mtx-record-XXXXXX";
    const int fd = ::mkstemp(path);
    EXPECT_GE(fd, 0);
    ::close(fd);
    std::ofstream(path, std::ios::binary) << bytes;
    const std::string command = "protoc " + arguments + " < " + path + " 2>&1";
    std::string out;
    if (FILE* pipe = ::popen(command.c_str(), "r")) {
        std::array<char, 4096> buffer{};
        std::size_t n;
        while ((n = std::fread(buffer.data(), 1, buffer.size(), pipe)) > 0) {
            out.append(buffer.data(), n);
        }
        EXPECT_EQ(::pclose(pipe), 0) << command << ": " << out;
    }
    std::filesystem::remove(path);
    return out;
}

std::string decodeWithSchema(const std::string& bytes) {
    return protoc(bytes, "--decode=mtxmetrics.AudioIssueDetected --proto_path=" +
                             kProtoFile.parent_path().string() + " " +
                             kProtoFile.filename().string());
}

std::string text(const AudioIssueDetected& record) {
    LineTextFormatter formatter;
    record.formatText(formatter, "AudioIssueDetected");
    return formatter.text();
}

struct ReadResult {
    bool ok;
    AudioIssueDetected record;
};

ReadResult read(const std::string& bytes) {
    Reader reader(bytes);
    ReadResult result;
    result.ok = result.record.readFrom(reader);
    return result;
}

TEST(AnAudioIssueDetected, WritesFieldsOneToFiveAsProtocReadsThem) {
    // The worker's record: no timestamp, so field 1 is absent; the number 12 as its text.
    AudioIssueDetected record;
    record.issuetype = "stall";
    record.node = "12";
    record.rtaidclient = "client";
    record.duration = 5;
    EXPECT_EQ(wireOf(record),
              "\x10\x05\x1a\x05stall\x22\x02"
              "12\x2a\x06"
              "client"s);

    // Every field, a negative duration sign-extended to ten bytes, bytes that are not text.
    record.setTimestamp(1700000000123);
    record.duration = -5;
    record.rtaidclient = "c\x01\xff"s;
    const std::string wire = wireOf(record);
    EXPECT_EQ(wire.substr(wire.find('\x10'), 11), "\x10\xfb\xff\xff\xff\xff\xff\xff\xff\xff\x01"s);
    EXPECT_EQ(protoc(wire, "--decode_raw"),
              "1: 1700000000123\n2: 18446744073709551611\n3: \"stall\"\n4: \"12\"\n"
              "5: \"c\\001\\377\"\n");
    EXPECT_EQ(decodeWithSchema(wire),
              "timestamp: 1700000000123\nduration: -5\nissuetype: \"stall\"\nnode: \"12\"\n"
              "rtaidclient: \"c\\001\\377\"\n");

    // Empty strings and a zero duration are written all the same.
    EXPECT_EQ(wireOf(AudioIssueDetected{}), "\x10\x00\x1a\x00\x22\x00\x2a\x00"s);
    EXPECT_EQ(protoc(wireOf(AudioIssueDetected{}), "--decode_raw"),
              "2: 0\n3: \"\"\n4: \"\"\n5: \"\"\n");
}

TEST(AnAudioIssueDetected, FormatsItsTextInAlphabeticalOrderEscapedAsProtocDoes) {
    AudioIssueDetected record;
    record.duration = -7;
    record.issuetype = "a\"b\\c\n\r\t'\x01\xc3\xa9\x7f"s;
    record.rtaidclient = "r";
    // Without a timestamp, protoc's field order is the alphabetical one too.
    const std::string mine = text(record);
    std::string theirs = decodeWithSchema(wireOf(record));
    for (auto& c : theirs) {
        c = c == '\n' ? ' ' : c;
    }
    EXPECT_EQ(mine, "AudioIssueDetected { " + theirs + "}");
    EXPECT_EQ(
        mine,
        "AudioIssueDetected { duration: -7 issuetype: \"a\\\"b\\\\c\\n\\r\\t\\'\\001\\303\\251"
        "\\177\" node: \"\" rtaidclient: \"r\" }");

    record.setTimestamp(18446744073709551615u);
    EXPECT_EQ(text(record).substr(text(record).find("rtaidclient")),
              "rtaidclient: \"r\" timestamp: 18446744073709551615 }");
}

TEST(AnAudioIssueDetected, ReadsFieldsByTheirNumberAloneAndLetALaterOneWin) {
    // Field 1 tagged as a string: its length byte is read as the timestamp, and reading goes on
    // with the bytes that would have been the string.
    auto r = read("\x0a\x03\x10\x07"s);
    EXPECT_TRUE(r.ok);
    EXPECT_TRUE(r.record.hasTimestamp());
    EXPECT_EQ(r.record.timestamp, 3u);
    EXPECT_EQ(r.record.duration, 7);

    // A string field tagged as a varint still reads a length and bytes; a repeated field
    // overwrites; duration keeps the low 32 bits of a 64-bit varint.
    r = read("\x18\x02hi\x1a\x01x\x1a\x02yz\x10\xff\xff\xff\xff\x1f\x08\x01\x08\x02"s);
    EXPECT_TRUE(r.ok);
    EXPECT_EQ(r.record.issuetype, "yz");
    EXPECT_EQ(r.record.duration, -1);
    EXPECT_EQ(r.record.timestamp, 2u);

    // An end-group tag ends the read successfully, even one whose field number is known; what
    // follows is not read.
    r = read("\x10\x01\x1c\x10\x02"s);
    EXPECT_TRUE(r.ok);
    EXPECT_EQ(r.record.duration, 1);

    // No bytes: success, nothing set.
    r = read("");
    EXPECT_TRUE(r.ok);
    EXPECT_EQ(r.record, AudioIssueDetected{});
}

TEST(AnAudioIssueDetected, SkipsUnknownFieldsByWireTypeAndRefusesMalformedOnes) {
    struct Case {
        const char* what;
        std::string bytes;
        bool ok;
    };
    const std::string known = "\x10\x09"s;  // duration 9, read after what is skipped
    const std::vector<Case> cases = {
        {"varint", "\x30\xff\x7f"s + known, true},
        {"fixed64", "\x31" + std::string(8, 'x') + known, true},
        {"length-delimited",
         "\x32\x03"
         "abc"s +
             known,
         true},
        {"fixed32", "\x35" + std::string(4, 'x') + known, true},
        {"field number 0", "\x00\x05"s + known, true},
        {"a large field number", "\xf8\xff\xff\xff\x0f\x01"s + known, true},
        {"group with fields and a nested group", "\x3b\x08\x01\x43\x44\x12\x00\x3c"s + known, true},
        {"fixed64 cut short", "\x31" + std::string(7, 'x'), false},
        {"fixed32 cut short", "\x35\x00\x00"s, false},
        {"length-delimited cut short",
         "\x32\x05"
         "abc"s,
         false},
        {"length beyond any buffer", "\x32\xff\xff\xff\xff\xff\xff\xff\xff\xff\x01"s, false},
        {"varint cut short", "\x30\x80"s, false},
        {"wire type 6", "\x36\x00"s + known, false},
        {"wire type 7", "\x37\x00"s + known, false},
        {"group without its end", "\x3b\x08\x01"s, false},
        {"group ended by another field", "\x3b\x08\x01\x44"s + known, false},
        {"tag cut short", "\x10\x01\x80"s, false},
        {"known varint cut short", "\x10\xff"s, false},
        {"known string cut short",
         "\x1a\x05"
         "ab"s,
         false},
        {"known string length cut short", "\x1a\x80"s, false},
    };
    for (const auto& c : cases) {
        const auto r = read(c.bytes);
        EXPECT_EQ(r.ok, c.ok) << c.what;
        if (c.ok) {
            EXPECT_EQ(r.record.duration, 9) << c.what;
        }
    }

    // Groups nest up to the reader's limit; one level more is refused.
    const auto nested = [](int depth) {
        std::string bytes;
        for (int i = 0; i < depth; ++i) {
            bytes += "\x3b";
        }
        for (int i = 0; i < depth; ++i) {
            bytes += "\x3c";
        }
        return bytes + "\x10\x09";
    };
    EXPECT_TRUE(read(nested(Reader::kMaxGroupDepth)).ok);
    EXPECT_FALSE(read(nested(Reader::kMaxGroupDepth + 1)).ok);
}

TEST(AnAudioIssueDetected, TakesARunOfMoreThanTenTagBytesAsTagZero) {
    // Read in full, these ten bytes would make a tag of wire type 7, which no skip accepts; cut
    // at ten they are tag 0 (field 0, a varint), whose value 0x01 is skipped.
    auto r = read(std::string(10, '\xff') + "\x01\x10\x09"s);
    EXPECT_TRUE(r.ok);
    EXPECT_EQ(r.record.duration, 9);
    // A value varint of more than ten bytes reads as 0 (over the 5 before it), and reading goes on
    // after its tenth byte.
    r = read("\x10\x05\x10"s + std::string(10, '\x80') + "\x1a\x01x"s);
    EXPECT_TRUE(r.ok);
    EXPECT_EQ(r.record.duration, 0);
    EXPECT_EQ(r.record.issuetype, "x");
}

TEST(AnAudioIssueDetected, ComparesAndHashesIgnoringAnUnsetTimestampAndUnusedBits) {
    AudioIssueDetected a;
    a.issuetype = "t";
    a.duration = -3;
    AudioIssueDetected b = a;
    b.timestamp = 99;  // stored, but its presence bit is clear
    b.has = 0xfffffffe;
    EXPECT_EQ(a, b);
    EXPECT_EQ(a.hash_value(), b.hash_value());
    EXPECT_EQ(std::hash<AudioIssueDetected>{}(a), a.hash_value());

    b.setTimestamp(99);
    EXPECT_NE(a, b);
    a.setTimestamp(98);
    EXPECT_NE(a, b);
    a.timestamp = 99;
    EXPECT_EQ(a, b);
    for (auto change : {+[](AudioIssueDetected& r) { r.duration = 4; },
                        +[](AudioIssueDetected& r) { r.issuetype += "x"; },
                        +[](AudioIssueDetected& r) { r.node = "n"; },
                        +[](AudioIssueDetected& r) { r.rtaidclient = std::string(1, '\0'); }}) {
        AudioIssueDetected c = a;
        change(c);
        EXPECT_NE(a, c);
    }

    // The hash follows its definition: timestamp XOR sign-extended duration XOR string hashes.
    const std::hash<std::string> h;
    EXPECT_EQ(a.hash_value(),
              99u ^ static_cast<std::size_t>(std::int64_t{-3}) ^ h("t") ^ h("") ^ h(""));
}

TEST(AnAudioIssueDetected, CopiesAndExchangesEveryFieldAndThePresenceMask) {
    AudioIssueDetected a;
    a.issuetype = "a-type";
    a.node = "a-node";
    a.rtaidclient = "a-client";
    a.setTimestamp(1);
    a.duration = 1;
    a.has |= 0x80;
    AudioIssueDetected b;
    b.issuetype = "b-type";
    b.duration = 2;

    const AudioIssueDetected copy = a;
    EXPECT_EQ(copy.has, a.has);
    EXPECT_EQ(copy, a);

    AudioIssueDetected target = b;
    target = std::move(a);  // exchanges: the source now holds what the target held
    EXPECT_EQ(target, copy);
    EXPECT_EQ(target.has, copy.has);
    EXPECT_EQ(a, b);  // NOLINT(bugprone-use-after-move): moving exchanges by definition

    swap(target, a);
    EXPECT_EQ(target, b);
    EXPECT_EQ(a.has, copy.has);
    EXPECT_EQ(a, copy);

    const AudioIssueDetected moved(std::move(a));
    EXPECT_EQ(moved, copy);
    EXPECT_EQ(a, AudioIssueDetected{});  // NOLINT(bugprone-use-after-move)
}

TEST(AnAudioIssueDetected, ReadsBackWhatItWritesAndReEncodesWhatItAccepts) {
    std::mt19937_64 random(20240131);
    const auto randomBytes = [&](std::size_t maximum) {
        std::string s(random() % (maximum + 1), '\0');
        for (auto& c : s) {
            c = static_cast<char>(random());
        }
        return s;
    };
    std::unordered_set<std::size_t> hashes;
    for (int i = 0; i < 2000; ++i) {
        AudioIssueDetected record;
        record.issuetype = randomBytes(i % 7 == 0 ? 300 : 20);
        record.node = randomBytes(5);
        record.rtaidclient = randomBytes(40);
        record.duration = static_cast<std::int32_t>(random());
        if (random() % 2) {
            record.setTimestamp(random() >> (random() % 64));
        }
        const auto r = read(wireOf(record));
        ASSERT_TRUE(r.ok) << i;
        ASSERT_EQ(r.record, record) << i;
        ASSERT_EQ(r.record.hash_value(), record.hash_value()) << i;
        hashes.insert(record.hash_value());

        // Random bytes: whatever is accepted writes itself out canonically and reads back equal.
        const auto noise = read(randomBytes(24));
        if (noise.ok) {
            const auto again = read(wireOf(noise.record));
            ASSERT_TRUE(again.ok) << i;
            ASSERT_EQ(again.record, noise.record) << i;
            ASSERT_EQ(wireOf(again.record), wireOf(noise.record)) << i;
        }
    }
    EXPECT_GT(hashes.size(), 1990u) << "distinct records hash apart";
}

}  // namespace
}  // namespace mtxmetrics

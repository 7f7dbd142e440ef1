// The metrics framework's side of a metric record: the Protocol Buffers binary wire format (as far
// as the records need it), a text formatter interface, and the message base that every record
// class derives from.
//
// This is a codec of its own, with no dependency beyond the standard library, so that the daemon,
// qvreportctl and the fuzz targets link it alone.
//
// Wire format, in short: a record is a sequence of fields, each a tag (field number << 3 | wire
// type, as a varint) followed by its value. Wire types: 0 varint, 1 fixed 64-bit, 2
// length-delimited (a varint length, then that many bytes), 3 start group, 4 end group, 5 fixed
// 32-bit. A varint is little-endian base 128: seven bits a byte, high bit set on every byte but the
// last.
//
// Reading rules this reader keeps (records rely on them):
// - A varint is at most ten bytes. After ten bytes that all have their high bit set, the read
//   yields 0 and stops there (the error flag stays clear; what follows is read as usual). A buffer
//   that ends inside a varint sets the error flag and yields 0.
// - The error flag is sticky: once set, every read yields 0 or an empty string and consumes
//   nothing.
// - Skipping an unknown field by its wire type: a varint is read and dropped; fixed 64-bit and
//   32-bit values need 8 and 4 bytes; a length-delimited value needs its whole length. A group
//   (wire type 3) is skipped up to the end-group tag of the same field number, skipping the fields
//   inside it by these same rules, nested groups included, at most kMaxGroupDepth deep. Skipping
//   fails (and sets the error flag) on data that end early, an end-group tag of another field
//   number, a group nested deeper than that, a lone end-group tag and wire types 6 and 7.
//
// Thread safety: plain values; a Writer, Reader or formatter belongs to one thread at a time.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace mtxmetrics {

enum WireType : std::uint32_t {
    kWireTypeVarint = 0,
    kWireTypeFixed64 = 1,
    kWireTypeLengthDelimited = 2,
    kWireTypeStartGroup = 3,
    kWireTypeEndGroup = 4,
    kWireTypeFixed32 = 5,
};

// Appends fields in the wire format to a byte buffer of its own.
class Writer {
  public:
    // An unsigned 64-bit varint field.
    void writeVarint(std::uint64_t value, std::uint32_t fieldNumber);
    // A signed 32-bit varint field: a negative value is sign-extended to 64 bits, so it always
    // takes ten bytes, as the wire format encodes int32.
    void writeInt32(std::int32_t value, std::uint32_t fieldNumber);
    // A length-delimited field holding bytes as they are.
    void writeData(std::string_view bytes, std::uint32_t fieldNumber);

    const std::string& data() const { return data_; }
    // The bytes written so far; the writer is empty afterwards.
    std::string takeData() { return std::move(data_); }

  private:
    void appendVarint(std::uint64_t value);
    void appendTag(std::uint32_t fieldNumber, WireType wireType);

    std::string data_;
};

// Reads the wire format from a byte buffer the caller keeps alive: a read position, an end and a
// sticky error flag.
class Reader {
  public:
    // Groups nested deeper than this are refused when skipped.
    static constexpr int kMaxGroupDepth = 64;

    explicit Reader(std::string_view bytes) : data_(bytes) {}

    std::size_t position() const { return position_; }
    std::size_t length() const { return data_.size(); }
    bool atEnd() const { return position_ >= data_.size(); }
    bool hasError() const { return error_; }
    void setError() { error_ = true; }

    // A varint of at most ten bytes (see the rules above).
    std::uint64_t readVarint();
    // A length-delimited value's bytes; empty with the error flag set when the data end before
    // the length says.
    std::string readData();
    // Skips one field whose tag was just read. False (and the error flag set) when the data are
    // malformed.
    bool skipField(std::uint64_t fieldNumber, std::uint32_t wireType);

  private:
    bool skipBytes(std::uint64_t count);
    bool skipGroup(std::uint64_t fieldNumber, int depth);
    bool skipFieldAtDepth(std::uint64_t fieldNumber, std::uint32_t wireType, int depth);

    std::string_view data_;
    std::size_t position_ = 0;
    bool error_ = false;
};

// What a record's formatText asks of a formatter: named objects holding named values. Values
// come in the order the record gives them.
class TextFormatter {
  public:
    virtual ~TextFormatter() = default;
    virtual void beginObject(const char* name) = 0;
    virtual void formatInt32(const char* name, std::int32_t value) = 0;
    virtual void formatUInt64(const char* name, std::uint64_t value) = 0;
    // A byte string (not necessarily text).
    virtual void formatString(const char* name, std::string_view bytes) = 0;
    virtual void endObject() = 0;
};

// The text format on one line, for people: `name { duration: 5 issuetype: "stall" }`. Strings
// are quoted; quotes, a backslash and the bytes outside printable ASCII are escaped (\n, \r, \t,
// \", \', \\, else three octal digits) exactly as protoc prints a bytes field.
class LineTextFormatter final : public TextFormatter {
  public:
    void beginObject(const char* name) override;
    void formatInt32(const char* name, std::int32_t value) override;
    void formatUInt64(const char* name, std::uint64_t value) override;
    void formatString(const char* name, std::string_view bytes) override;
    void endObject() override;

    const std::string& text() const { return text_; }

  private:
    void beginValue(const char* name);

    std::string text_;
};

// The message base of the metrics framework: a record that reads, writes and formats itself.
class Message {
  public:
    virtual ~Message() = default;
    // Reads fields until the reader ends; true when it ends without its error flag set.
    virtual bool readFrom(Reader& reader) = 0;
    virtual void writeTo(Writer& writer) const = 0;
    virtual void formatText(TextFormatter& formatter, const char* name) const = 0;

  protected:
    Message() = default;
    Message(const Message&) = default;
    Message& operator=(const Message&) = default;
};

}  // namespace mtxmetrics

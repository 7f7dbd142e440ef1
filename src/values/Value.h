// Payload values: what clients put in a message, and what workers derive from it.
//
// A Value is one of null, bool, signed or unsigned 64-bit integer, double, string, bytes, date,
// array or dictionary. Containers nested inside a Value are immutable and shared: copying a Value
// that holds an array or a dictionary copies a reference, never the contents, which keeps the
// one-level copies that sessions and workers make cheap. The top-level payload of a message is a
// mutable Dictionary owned by that message.
//
// Thread safety: a Value and a Dictionary are plain values; concurrent reads are safe, a write
// needs exclusive access. Shared nested containers are never written, so they are safe to read
// from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "values/DictionaryKey.h"

namespace qv {

class Value;
class Dictionary;

using Array = std::vector<Value>;
using Bytes = std::vector<std::uint8_t>;

// A point in time, seconds since 1970-01-01 UTC.
struct Date {
    double secondsSince1970 = 0;
    bool operator==(const Date&) const = default;
};

class Value {
  public:
    enum class Kind { Null, Bool, Int, UInt, Double, String, Bytes, Date, Array, Dictionary };

    Value() = default;
    Value(std::nullptr_t) {}
    Value(bool b) : v_(b) {}
    Value(int i) : v_(std::int64_t{i}) {}
    Value(long i) : v_(std::int64_t{i}) {}
    Value(long long i) : v_(std::int64_t{i}) {}
    Value(unsigned u) : v_(std::uint64_t{u}) {}
    Value(unsigned long u) : v_(std::uint64_t{u}) {}
    Value(unsigned long long u) : v_(std::uint64_t{u}) {}
    Value(float d) : v_(double{d}) {}
    Value(double d) : v_(d) {}
    Value(const char* s) : v_(std::string(s)) {}
    Value(std::string_view s) : v_(std::string(s)) {}
    Value(std::string s) : v_(std::move(s)) {}
    Value(Bytes b) : v_(std::make_shared<const Bytes>(std::move(b))) {}
    Value(Date d) : v_(d) {}
    Value(Array a);
    Value(Dictionary d);

    Kind kind() const { return static_cast<Kind>(v_.index()); }
    bool isNull() const { return kind() == Kind::Null; }
    bool isNumber() const;  // bool, integers and doubles: what a number formatter accepts
    bool isString() const { return kind() == Kind::String; }
    bool isArray() const { return kind() == Kind::Array; }
    bool isDictionary() const { return kind() == Kind::Dictionary; }

    // Typed access; nullptr when the value is of another kind.
    const std::string* asString() const { return std::get_if<std::string>(&v_); }
    const Bytes* asBytes() const;
    const Array* asArray() const;
    const Dictionary* asDictionary() const;
    std::optional<Date> asDate() const;
    // The value as a number, or nothing when it is not a number (bool counts as 0 or 1).
    std::optional<double> asDouble() const;
    std::optional<std::int64_t> asInt64() const;    // integers and bools; doubles truncated
    std::optional<std::uint64_t> asUInt64() const;  // only a value held as unsigned
    // Truthiness as a boolean value reads: numbers are true when nonzero, a string is true when
    // it starts with Y, y, T, t or a nonzero digit; anything else is false.
    bool boolValue() const;
    // The readers payload rules use, which take text as well as numbers: a string reads as the
    // number it starts with (white space before it skipped; "0.5 dB" is 0.5, "3.9" as an integer
    // is 3), and anything that is neither a number nor such a string reads as 0.
    //
    // doubleValue: numbers as they are; a string's leading decimal number (no hexadecimal, no
    // "inf" or "nan"), +-infinity when it overflows.
    double doubleValue() const;
    // longLongValue: integers as they are (unsigned ones clamped), doubles truncated toward zero
    // (NaN is 0, clamped at the ends); a string's leading integer, clamped on overflow.
    std::int64_t longLongValue() const;
    // intValue: a string's leading integer clamped to 32 bits; a number as longLongValue reads it,
    // then cut to its low 32 bits as a C conversion does.
    std::int32_t intValue() const;

    // Numbers compare by value across kinds (1 == 1.0, and a bool is the number 0 or 1, as a
    // boxed number is); a string never equals a number; containers compare element by element.
    bool operator==(const Value& other) const;
    bool operator!=(const Value& other) const { return !(*this == other); }
    // Stricter than ==: the same kind holding the same bits (so 1 is not 1.0, nor 0.0 -0.0), and
    // containers only when they are the very same object. What prints the same, cheaply.
    bool sameAs(const Value& other) const;

    // The printed form used in log lines and message descriptions.
    std::string description() const;

    // A copy in which every nested container is rebuilt, sharing nothing with this value.
    Value deepCopy() const;

    // Number of values this one is made of, itself included, and its nesting depth (a scalar is
    // 0 deep, an empty container 1). Used to keep client input within bounds.
    std::size_t valueCount() const;
    std::size_t depth() const;
    // Heap memory this value holds beyond its own sizeof, allocator overhead included: an
    // estimate for memory budgets, not an exact figure. Shared containers count in full.
    std::size_t approximateHeapBytes() const;

  private:
    std::optional<__int128> asExactInteger() const;
    bool numbersEqual(const Value& other) const;

    std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string,
                 std::shared_ptr<const Bytes>, Date, std::shared_ptr<const Array>,
                 std::shared_ptr<const Dictionary>>
        v_;
};

// A dictionary from string keys to values that keeps insertion order (setting an existing key
// keeps its place) and finds keys fast: small dictionaries are searched in place, larger ones
// through an index built on first need.
class Dictionary {
  public:
    using Entry = std::pair<DictionaryKey, Value>;
    using const_iterator = std::vector<Entry>::const_iterator;
    // What a dictionary is written as in code: {{"key", value}, ...}.
    using Literal = std::initializer_list<std::pair<std::string_view, Value>>;

    Dictionary() = default;
    Dictionary(Literal entries);
    // A copy with room for extra more entries.
    Dictionary(const Dictionary& other, std::size_t extra);

    std::size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }
    const_iterator begin() const { return entries_.begin(); }
    const_iterator end() const { return entries_.end(); }

    const Value* find(std::string_view key) const;
    Value* find(std::string_view key);
    // By a key of another dictionary: usually a pointer comparison per entry.
    const Value* find(const DictionaryKey& key) const;
    Value* find(const DictionaryKey& key);
    bool contains(std::string_view key) const { return find(key) != nullptr; }
    // find(), trying the entry at position hint first: cheap when two dictionaries hold their
    // keys in the same order.
    const Value* findNear(const DictionaryKey& key, std::size_t hint) const;

    // Inserts at the end, or replaces the value in place when the key exists.
    void set(std::string_view key, Value value);
    void set(const DictionaryKey& key, Value value);
    // Removes the key; returns whether it was there.
    bool erase(std::string_view key);
    // Sets every entry of other, in other's order (later values win).
    void merge(const Dictionary& other);
    void clear();
    void reserve(std::size_t n) { entries_.reserve(n); }
    // Makes room for exactly extra more entries (giving back spare room) without changing what
    // the dictionary holds.
    void reserveMore(std::size_t extra);

    // Same keys with equal values; order does not matter.
    bool operator==(const Dictionary& other) const;
    bool operator!=(const Dictionary& other) const { return !(*this == other); }

    // Heap memory the dictionary holds beyond its own sizeof (see Value::approximateHeapBytes).
    std::size_t approximateHeapBytes() const;

    std::string description() const;

  private:
    std::ptrdiff_t indexOf(std::string_view key) const;
    std::ptrdiff_t indexOf(const DictionaryKey& key) const;
    // Appends a key known to be absent.
    void append(DictionaryKey key, Value value);
    void rebuildSlots();
    void insertSlot(std::uint32_t entryIndex);

    std::vector<Entry> entries_;
    // Open-addressing hash table of positions in entries_, kept only for large dictionaries and
    // always up to date, so that lookups never write (concurrent readers stay safe).
    std::vector<std::uint32_t> slots_;
};

// A possibly absent value as a format's "%@" puts it in text: a string as it is (unquoted),
// any other kind by its description, "(null)" when absent.
std::string QVReportingValueText(const Value* value);

}  // namespace qv

// The keys of payload dictionaries. Clients repeat the same few dozen keys message after message,
// so a key's text is kept once and a key points at it: copying a key copies a pointer (no
// allocation), two keys of one text usually compare by pointer, and a text's hash and whether it
// holds a blank are worked out once, not per message.
//
// Texts of at most kMaxInternedLength bytes are interned in a process-wide table of at most
// kMaxInterned texts, kept for the life of the process. Any other text (a long one, or one that
// finds the table full, as a client inventing keys would) is held by its keys with a reference
// count, and goes with the last of them: distinct keys cost memory only while they are used.
// Either way a key compares by its text; interning only makes the common case cheap.
//
// Thread safety: a key is an immutable value, safe to copy, compare and read from any thread.
// Making a key takes the table's lock only the first time a thread meets an interned text; a
// small per-thread cache answers after that.
#pragma once

#include <fmt/format.h>

#include <atomic>
#include <compare>
#include <cstddef>
#include <cstdint>
#include <iosfwd>
#include <string>
#include <string_view>

namespace qv {

class DictionaryKey {
  public:
    // Interned texts are this long at most; the table holds at most this many.
    static constexpr std::size_t kMaxInternedLength = 128;
    static constexpr std::size_t kMaxInterned = 65536;

    DictionaryKey();  // the empty text
    // Explicit: making a key may take the table's lock, so it is never done in passing.
    explicit DictionaryKey(std::string_view text);
    explicit DictionaryKey(const std::string& text) : DictionaryKey(std::string_view(text)) {}
    explicit DictionaryKey(const char* text) : DictionaryKey(std::string_view(text)) {}

    DictionaryKey(const DictionaryKey& other) noexcept : text_(other.text_) { retain(); }
    DictionaryKey(DictionaryKey&& other) noexcept;
    DictionaryKey& operator=(const DictionaryKey& other) noexcept;
    DictionaryKey& operator=(DictionaryKey&& other) noexcept;
    ~DictionaryKey() { release(); }

    const std::string& str() const { return text_->text; }
    std::string_view view() const { return text_->text; }
    operator const std::string&() const { return text_->text; }
    operator std::string_view() const { return text_->text; }
    const char* c_str() const { return text_->text.c_str(); }
    const char* data() const { return text_->text.data(); }
    std::size_t size() const { return text_->text.size(); }
    bool empty() const { return text_->text.empty(); }
    std::size_t find(char c, std::size_t from = 0) const { return text_->text.find(c, from); }
    std::size_t find(std::string_view s, std::size_t from = 0) const {
        return text_->text.find(s, from);
    }
    bool starts_with(std::string_view prefix) const { return view().starts_with(prefix); }
    bool ends_with(std::string_view suffix) const { return view().ends_with(suffix); }

    // std::hash<std::string_view> of the text, computed once.
    std::size_t hash() const { return text_->hash; }
    // Whether the text holds a " " (sessions replace blanks in keys).
    bool hasBlank() const { return text_->hasBlank; }
    // Whether the text is interned (for tests and accounting).
    bool isInterned() const { return text_->interned; }
    // Heap memory this key alone holds (an interned text belongs to the table, not to its keys).
    std::size_t ownedHeapBytes() const;

    // Keys with one identity have one text; two interned keys of different identities have
    // different texts (the table holds each text once).
    const void* identity() const { return text_; }

    bool operator==(const DictionaryKey& other) const {
        if (text_ == other.text_) {
            return true;
        }
        if (text_->interned && other.text_->interned) {
            return false;
        }
        return text_->hash == other.text_->hash && text_->text == other.text_->text;
    }
    bool operator==(std::string_view text) const { return text_->text == text; }
    bool operator==(const char* text) const { return text_->text == text; }
    std::strong_ordering operator<=>(const DictionaryKey& other) const {
        return text_->text <=> other.text_->text;
    }
    std::strong_ordering operator<=>(std::string_view text) const { return view() <=> text; }

    // For tests: how many texts the table holds.
    static std::size_t TEST_internedCount();

  private:
    struct Text {
        std::string text;
        std::size_t hash = 0;
        bool hasBlank = false;
        bool interned = false;
        mutable std::atomic<std::uint32_t> references{1};  // counted only when not interned
    };

    static const Text* makeText(std::string_view text);
    static const Text* emptyText();

    void retain() const {
        if (!text_->interned) {
            text_->references.fetch_add(1, std::memory_order_relaxed);
        }
    }
    void release() const {
        if (!text_->interned && text_->references.fetch_sub(1, std::memory_order_acq_rel) == 1) {
            delete text_;
        }
    }

    const Text* text_;
};

// The text, for streams (test output among them).
std::ostream& operator<<(std::ostream& out, const DictionaryKey& key);

}  // namespace qv

template <>
struct std::hash<qv::DictionaryKey> {
    std::size_t operator()(const qv::DictionaryKey& key) const noexcept { return key.hash(); }
};

template <>
struct fmt::formatter<qv::DictionaryKey> : fmt::formatter<std::string_view> {
    template <typename FormatContext>
    auto format(const qv::DictionaryKey& key, FormatContext& ctx) const {
        return fmt::formatter<std::string_view>::format(key.view(), ctx);
    }
};

#include "values/DictionaryKey.h"

#include <array>
#include <mutex>
#include <ostream>
#include <unordered_map>

namespace qv {

namespace {

// The interned texts by their text; the texts live as long as the process.
struct Table {
    std::mutex mutex;
    std::unordered_map<std::string_view, const void*> texts;  // guarded by mutex
};

Table& table() {
    static Table* t = new Table;  // never destroyed: keys may outlive static destructors
    return *t;
}

// A thread's recently made interned texts, by hash: most keys are found here, without a lock. Two
// ways a set, so that a client's few dozen keys rarely evict each other (with one way, two of a
// payload's ten keys sharing a slot would both miss on every message).
constexpr std::size_t kCacheSets = 256;

}  // namespace

const DictionaryKey::Text* DictionaryKey::emptyText() {
    static const Text* empty = [] {
        auto* t = new Text;
        t->hash = std::hash<std::string_view>{}(std::string_view());
        t->interned = true;
        return t;
    }();
    return empty;
}

const DictionaryKey::Text* DictionaryKey::makeText(std::string_view text) {
    const std::size_t hash = std::hash<std::string_view>{}(text);
    const bool internable = text.size() <= kMaxInternedLength;
    if (internable) {
        thread_local std::array<std::array<const Text*, 2>, kCacheSets> cache{};
        auto& ways = cache[hash % kCacheSets];
        auto holds = [&](const Text* cached) {
            return cached != nullptr && cached->hash == hash && cached->text == text;
        };
        if (holds(ways[0])) {
            return ways[0];
        }
        if (holds(ways[1])) {
            std::swap(ways[0], ways[1]);  // the most recent first
            return ways[0];
        }
        auto remember = [&](const Text* found) {
            ways[1] = ways[0];
            ways[0] = found;
            return found;
        };
        Table& t = table();
        std::lock_guard lock(t.mutex);
        if (auto it = t.texts.find(text); it != t.texts.end()) {
            return remember(static_cast<const Text*>(it->second));
        }
        if (t.texts.size() < kMaxInterned) {
            auto* made = new Text;
            made->text.assign(text);
            made->hash = hash;
            made->hasBlank = text.find(' ') != std::string_view::npos;
            made->interned = true;
            t.texts.emplace(made->text, made);
            return remember(made);
        }
    }
    auto* owned = new Text;
    owned->text.assign(text);
    owned->hash = hash;
    owned->hasBlank = text.find(' ') != std::string_view::npos;
    return owned;
}

DictionaryKey::DictionaryKey() : text_(emptyText()) {}

DictionaryKey::DictionaryKey(std::string_view text)
    : text_(text.empty() ? emptyText() : makeText(text)) {}

DictionaryKey::DictionaryKey(DictionaryKey&& other) noexcept : text_(other.text_) {
    other.text_ = emptyText();
}

DictionaryKey& DictionaryKey::operator=(const DictionaryKey& other) noexcept {
    if (text_ != other.text_) {
        other.retain();
        release();
        text_ = other.text_;
    }
    return *this;
}

DictionaryKey& DictionaryKey::operator=(DictionaryKey&& other) noexcept {
    if (this != &other) {
        release();
        text_ = other.text_;
        other.text_ = emptyText();
    }
    return *this;
}

std::size_t DictionaryKey::ownedHeapBytes() const {
    if (text_->interned) {
        return 0;
    }
    constexpr std::size_t kAllocationOverhead = 16;
    std::size_t n = sizeof(Text) + kAllocationOverhead;
    if (text_->text.capacity() > 15) {
        n += text_->text.capacity() + 1 + kAllocationOverhead;
    }
    return n;
}

std::ostream& operator<<(std::ostream& out, const DictionaryKey& key) {
    return out << key.view();
}

std::size_t DictionaryKey::TEST_internedCount() {
    Table& t = table();
    std::lock_guard lock(t.mutex);
    return t.texts.size();
}

}  // namespace qv

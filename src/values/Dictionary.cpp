// Dictionary: entries in insertion order, with an index of slots once it holds enough keys to
// make one worth keeping (see Value.h).
#include <algorithm>
#include <functional>
#include <iterator>
#include <limits>

#include "values/Value.h"

namespace qv {

namespace {

constexpr std::size_t kSmallDictionary = 16;  // searched linearly up to this size
constexpr std::uint32_t kEmptySlot = std::numeric_limits<std::uint32_t>::max();

}  // namespace

Dictionary::Dictionary(Literal entries) {
    entries_.reserve(entries.size());
    for (const auto& [k, v] : entries) {
        set(k, v);
    }
}

Dictionary::Dictionary(const Dictionary& other, std::size_t extra) : slots_(other.slots_) {
    entries_.reserve(other.size() + extra);
    entries_.insert(entries_.end(), other.entries_.begin(), other.entries_.end());
}

void Dictionary::reserveMore(std::size_t extra) {
    const std::size_t want = entries_.size() + extra;
    if (entries_.capacity() < want) {
        entries_.reserve(want);
    } else if (entries_.capacity() > want + want / 4) {
        // A dictionary that grew by doubling is kept at the size it will stay at.
        std::vector<Entry> tight;
        tight.reserve(want);
        std::move(entries_.begin(), entries_.end(), std::back_inserter(tight));
        entries_.swap(tight);
    }
}

std::ptrdiff_t Dictionary::indexOf(std::string_view key) const {
    if (slots_.empty()) {
        // Most keys differ in length or first letter: test those before comparing bytes.
        const std::size_t size = key.size();
        const char first = size ? key[0] : '\0';
        for (std::size_t i = 0; i < entries_.size(); ++i) {
            const std::string& k = entries_[i].first.str();
            if (k.size() == size && (size == 0 || (k[0] == first && k == key))) {
                return static_cast<std::ptrdiff_t>(i);
            }
        }
        return -1;
    }
    const std::size_t hash = std::hash<std::string_view>{}(key);
    const std::size_t mask = slots_.size() - 1;
    for (std::size_t s = hash & mask;; s = (s + 1) & mask) {
        const std::uint32_t i = slots_[s];
        if (i == kEmptySlot) {
            return -1;
        }
        if (entries_[i].first.hash() == hash && entries_[i].first == key) {
            return static_cast<std::ptrdiff_t>(i);
        }
    }
}

std::ptrdiff_t Dictionary::indexOf(const DictionaryKey& key) const {
    if (slots_.empty()) {
        for (std::size_t i = 0; i < entries_.size(); ++i) {
            if (entries_[i].first == key) {
                return static_cast<std::ptrdiff_t>(i);
            }
        }
        return -1;
    }
    const std::size_t mask = slots_.size() - 1;
    for (std::size_t s = key.hash() & mask;; s = (s + 1) & mask) {
        const std::uint32_t i = slots_[s];
        if (i == kEmptySlot) {
            return -1;
        }
        if (entries_[i].first == key) {
            return static_cast<std::ptrdiff_t>(i);
        }
    }
}

void Dictionary::insertSlot(std::uint32_t entryIndex) {
    const std::size_t mask = slots_.size() - 1;
    std::size_t s = entries_[entryIndex].first.hash() & mask;
    while (slots_[s] != kEmptySlot) {
        s = (s + 1) & mask;
    }
    slots_[s] = entryIndex;
}

void Dictionary::rebuildSlots() {
    slots_.clear();
    if (entries_.size() <= kSmallDictionary) {
        slots_.shrink_to_fit();
        return;
    }
    std::size_t capacity = 32;
    while (capacity < entries_.size() * 2) {
        capacity *= 2;
    }
    slots_.assign(capacity, kEmptySlot);
    for (std::uint32_t i = 0; i < entries_.size(); ++i) {
        insertSlot(i);
    }
}

const Value* Dictionary::find(std::string_view key) const {
    const auto i = indexOf(key);
    return i < 0 ? nullptr : &entries_[static_cast<std::size_t>(i)].second;
}

Value* Dictionary::find(std::string_view key) {
    const auto i = indexOf(key);
    return i < 0 ? nullptr : &entries_[static_cast<std::size_t>(i)].second;
}

const Value* Dictionary::find(const DictionaryKey& key) const {
    const auto i = indexOf(key);
    return i < 0 ? nullptr : &entries_[static_cast<std::size_t>(i)].second;
}

Value* Dictionary::find(const DictionaryKey& key) {
    const auto i = indexOf(key);
    return i < 0 ? nullptr : &entries_[static_cast<std::size_t>(i)].second;
}

void Dictionary::set(std::string_view key, Value value) {
    if (Value* existing = find(key)) {
        *existing = std::move(value);
        return;
    }
    append(DictionaryKey(key), std::move(value));
}

void Dictionary::set(const DictionaryKey& key, Value value) {
    if (Value* existing = find(key)) {
        *existing = std::move(value);
        return;
    }
    append(key, std::move(value));
}

void Dictionary::append(DictionaryKey key, Value value) {
    entries_.emplace_back(std::move(key), std::move(value));
    if (entries_.size() > kSmallDictionary) {
        // Keep the table at most half full so probes stay short.
        if (slots_.size() < entries_.size() * 2) {
            rebuildSlots();
        } else {
            insertSlot(static_cast<std::uint32_t>(entries_.size() - 1));
        }
    }
}

bool Dictionary::erase(std::string_view key) {
    const auto i = indexOf(key);
    if (i < 0) {
        return false;
    }
    entries_.erase(entries_.begin() + i);
    if (!slots_.empty()) {
        rebuildSlots();
    }
    return true;
}

const Value* Dictionary::findNear(const DictionaryKey& key, std::size_t hint) const {
    if (hint < entries_.size() && entries_[hint].first == key) {
        return &entries_[hint].second;
    }
    return find(key);
}

void Dictionary::merge(const Dictionary& other) {
    // Payloads of one client tend to repeat their keys in one order: look where the previous key
    // was found, one further, before searching.
    std::size_t hint = 0;
    for (const auto& [k, v] : other) {
        Value* existing = nullptr;
        if (hint < entries_.size() && entries_[hint].first == k) {
            existing = &entries_[hint].second;
        } else if (const auto i = indexOf(k); i >= 0) {
            hint = static_cast<std::size_t>(i);
            existing = &entries_[hint].second;
        }
        if (existing) {
            *existing = v;
            ++hint;
        } else {
            append(k, v);
            hint = entries_.size();
        }
    }
}

void Dictionary::clear() {
    entries_.clear();
    slots_.clear();
}

bool Dictionary::operator==(const Dictionary& other) const {
    if (size() != other.size()) {
        return false;
    }
    for (const auto& [k, v] : entries_) {
        const Value* o = other.find(k);
        if (!o || *o != v) {
            return false;
        }
    }
    return true;
}

}  // namespace qv

#include "values/FrozenPayload.h"

namespace qv {

FrozenPayload::FrozenPayload(const Dictionary& payload) {
    std::size_t chars = 0;
    for (const auto& [key, value] : payload) {
        chars += key.size();
        if (const std::string* s = value.asString()) {
            chars += s->size();
        }
    }
    text_.reserve(chars);
    entries_.reserve(payload.size());
    for (const auto& [key, value] : payload) {
        const std::string* s = value.asString();
        Entry& e =
            s ? entries_.emplace_back() : entries_.emplace_back(Entry{0, 0, 0, 0, false, value});
        // Offsets fit 32 bits: a payload is bounded far below that on its way in.
        e.keyBegin = static_cast<std::uint32_t>(text_.size());
        e.keyLength = static_cast<std::uint32_t>(key.size());
        text_ += key;
        if (s) {
            e.isText = true;
            e.textBegin = static_cast<std::uint32_t>(text_.size());
            e.textLength = static_cast<std::uint32_t>(s->size());
            text_ += *s;
        }
    }
}

Dictionary FrozenPayload::thaw(std::size_t extra) const {
    Dictionary d;
    d.reserve(entries_.size() + extra);
    for (const Entry& e : entries_) {
        const std::string_view key(text_.data() + e.keyBegin, e.keyLength);
        d.set(key, e.isText ? Value(std::string_view(text_.data() + e.textBegin, e.textLength))
                            : e.value);
    }
    return d;
}

}  // namespace qv

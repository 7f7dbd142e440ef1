#include "values/FrozenPayloads.h"

namespace qv {

void FrozenPayloads::append(const Dictionary& payload) {
    starts_.push_back(entries_.size());
    for (const auto& [key, value] : payload) {
        const std::string* s = value.asString();
        Entry& e = s ? entries_.emplace_back(Entry{key, 0, 0, true, {}})
                     : entries_.emplace_back(Entry{key, 0, 0, false, value});
        if (s) {
            e.textBegin = text_.size();
            // A string is bounded far below 4 GiB on its way in.
            e.textLength = static_cast<std::uint32_t>(s->size());
            text_ += *s;
        }
    }
}

void FrozenPayloads::reserveFor(std::size_t count, const Dictionary& like) {
    std::size_t text = 0;
    for (const auto& entry : like) {
        if (const std::string* s = entry.second.asString()) {
            text += s->size();
        }
    }
    starts_.reserve(starts_.size() + count);
    entries_.reserve(entries_.size() + count * like.size());
    text_.reserve(text_.size() + count * text);
}

Dictionary FrozenPayloads::thaw(std::size_t i, std::size_t extra) const {
    const std::size_t begin = starts_[i];
    const std::size_t end = i + 1 < starts_.size() ? starts_[i + 1] : entries_.size();
    Dictionary d;
    d.reserve(end - begin + extra);
    for (std::size_t n = begin; n < end; ++n) {
        const Entry& e = entries_[n];
        d.set(e.key, e.isText ? Value(std::string_view(text_.data() + e.textBegin, e.textLength))
                              : e.value);
    }
    return d;
}

}  // namespace qv

#include "values/FrozenPayloads.h"

namespace qv {

void FrozenPayloads::append(const Dictionary& payload) {
    starts_.push_back(entries_.size());
    for (const auto& [key, value] : payload) {
        const std::string* s = value.asString();
        Entry& e =
            s ? entries_.emplace_back() : entries_.emplace_back(Entry{0, 0, 0, 0, false, value});
        e.keyBegin = text_.size();
        e.keyLength = static_cast<std::uint32_t>(key.size());
        text_ += key;
        if (s) {
            e.isText = true;
            e.textBegin = text_.size();
            // A string is bounded far below 4 GiB on its way in.
            e.textLength = static_cast<std::uint32_t>(s->size());
            text_ += *s;
        }
    }
}

Dictionary FrozenPayloads::thaw(std::size_t i, std::size_t extra) const {
    const std::size_t begin = starts_[i];
    const std::size_t end = i + 1 < starts_.size() ? starts_[i + 1] : entries_.size();
    Dictionary d;
    d.reserve(end - begin + extra);
    for (std::size_t n = begin; n < end; ++n) {
        const Entry& e = entries_[n];
        const std::string_view key(text_.data() + e.keyBegin, e.keyLength);
        d.set(key, e.isText ? Value(std::string_view(text_.data() + e.textBegin, e.textLength))
                            : e.value);
    }
    return d;
}

}  // namespace qv

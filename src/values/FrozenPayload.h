// A copy of a payload's top level, made to be handed to another thread cheaply: the texts of its
// keys and string values go into one buffer, every other value is kept as it is (numbers by
// value, nested containers shared, as they are immutable). Two allocations however many entries
// the payload has, where a Dictionary copy makes one per long key or string and, past a dozen
// entries, one large enough to make the allocator tidy its free lists every time.
//
// The copy is taken where the payload lives (the reporting server queue), so later changes to the
// payload are not seen; it is turned back into a Dictionary (thaw) wherever it goes, in the
// payload's order.
//
// Thread safety: a plain value; concurrent reads are safe.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "values/Value.h"

namespace qv {

class FrozenPayload {
  public:
    FrozenPayload() = default;
    explicit FrozenPayload(const Dictionary& payload);

    std::size_t size() const { return entries_.size(); }
    bool empty() const { return entries_.empty(); }

    // The payload again, with room for extra more entries.
    Dictionary thaw(std::size_t extra = 0) const;

  private:
    struct Entry {
        std::uint32_t keyBegin;
        std::uint32_t keyLength;
        std::uint32_t textBegin;
        std::uint32_t textLength;
        bool isText;
        Value value;  // null for a string
    };

    std::vector<Entry> entries_;
    std::string text_;
};

}  // namespace qv

// Copies of payloads' top levels, made to be handed to another thread cheaply: keys are kept as
// they are (a key is a pointer to its text, shared by all threads), the string values of every
// payload go into one buffer, every other value is kept as it is (numbers by value, nested
// containers shared, as they are immutable), and the entries of all payloads sit in one array. A
// batch of payloads thus costs a few allocations in all, where Dictionary copies make one per long
// key or string, and, past a dozen entries, one large enough to make the allocator tidy its free
// lists every time; and what is freed on the other thread is a few large blocks, not many small
// ones that it would have to give back, under a lock, to the thread that allocated them.
//
// The copies are taken where the payloads live (the reporting server queue), so later changes to
// a payload are not seen; each is turned back into a Dictionary (thaw) wherever it goes, in its
// own order.
//
// Thread safety: a plain value; concurrent reads are safe, appends need exclusive access.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "values/Value.h"

namespace qv {

class FrozenPayloads {
  public:
    // Adds a copy of payload as the last one.
    void append(const Dictionary& payload);
    // Makes room for count payloads shaped like like (as many entries, as much text), so that a
    // batch that is filled one payload at a time does not keep moving to larger blocks.
    void reserveFor(std::size_t count, const Dictionary& like);

    // Number of payloads.
    std::size_t size() const { return starts_.size(); }
    bool empty() const { return starts_.empty(); }

    // Payload i as a Dictionary again, with room for extra more entries.
    Dictionary thaw(std::size_t i, std::size_t extra = 0) const;

  private:
    struct Entry {
        DictionaryKey key;
        std::size_t textBegin;
        std::uint32_t textLength;
        bool isText;
        Value value;  // null for a string
    };

    std::vector<Entry> entries_;
    std::string text_;
    std::vector<std::size_t> starts_;  // where each payload's entries begin
};

}  // namespace qv

// The Convo worker's stop summary: a dictionary that starts with "QV_Session_Summary_Event" = the
// session's service type and then holds, for every key of the messages folded in, the values of
// that key in message order, each printed as "%@" prints it (a string as it is, anything else by
// its description) and joined with "," (no spaces). Keys appear in the order they first appear.
//
// It is built in two halves, because the first runs on the reporting server queue and the second
// on the Convo queue. add() copies each value of a payload into its key's column as it is now
// (numbers as numbers, strings into one shared buffer, other values shared: nested containers are
// immutable), so later changes to the session's messages are not seen; no key is copied but a
// column's first. joined() prints and joins, which is most of the work, away from the server
// queue. For a session of a hundred thousand messages the copy takes a few allocations, not
// millions.
//
// Thread safety: a plain value; build it on one thread, then hand it to another (or read it from
// several).
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "session/QVReportingVocabulary.h"
#include "values/Value.h"

namespace qv {

class QVReportingConvoSessionSummary {
  public:
    static constexpr std::string_view kSummaryEventKey = "QV_Session_Summary_Event";

    // omittedKey: a key whose values are not kept at all, for a summary that would lose its
    // column before anyone sees it (empty: every key is kept).
    explicit QVReportingConvoSessionSummary(AudioServiceType serviceType,
                                            std::string_view omittedKey = {});

    // Appends every value of payload to its key's column, in the payload's order.
    void add(const Dictionary& payload);

    // The summary: each column's values joined with ",".
    Dictionary joined() const;

  private:
    // One value of a column. Numbers and booleans are kept as they are; a string as its place in
    // text_; anything else as its place in others_.
    struct Cell {
        enum class Kind : std::uint8_t { Text, Int, UInt, Double, Bool, Other };
        Kind kind;
        std::uint32_t length;  // Text: length of the text
        std::uint64_t bits;    // Text: offset in text_; Other: index in others_; else the value
    };
    struct Column {
        std::string key;
        std::vector<Cell> cells;
    };

    // The column of key, made when new, remembered as the one found at position (the key's place
    // in its payload).
    Column& columnFor(std::string_view key, std::size_t position);

    std::string omittedKey_;
    std::vector<Column> columns_;
    // Column number by key (looked up by view, without making a string).
    struct KeyHash {
        using is_transparent = void;
        std::size_t operator()(std::string_view key) const {
            return std::hash<std::string_view>{}(key);
        }
    };
    std::unordered_map<std::string, std::size_t, KeyHash, std::equal_to<>> index_;
    // Column of the key found at each position of the previous payload: payloads of one kind
    // list their keys in one order, so the index is rarely needed.
    std::vector<std::size_t> byPosition_;
    std::string text_;
    std::vector<Value> others_;
};

}  // namespace qv

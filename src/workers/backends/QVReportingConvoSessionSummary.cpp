#include "workers/backends/QVReportingConvoSessionSummary.h"

#include <fmt/compile.h>
#include <fmt/format.h>

#include <bit>

namespace qv {

QVReportingConvoSessionSummary::QVReportingConvoSessionSummary(AudioServiceType serviceType,
                                                               std::string_view omittedKey)
    : omittedKey_(omittedKey) {
    Column& first = columns_.emplace_back();
    first.key = kSummaryEventKey;
    first.cells.push_back({Cell::Kind::UInt, 0, serviceType});
    index_.emplace(first.key, 0);
}

QVReportingConvoSessionSummary::Column& QVReportingConvoSessionSummary::columnFor(
    std::string_view key, std::size_t position) {
    std::size_t at;
    if (const auto it = index_.find(key); it != index_.end()) {
        at = it->second;
    } else {
        at = columns_.size();
        columns_.emplace_back().key = key;
        index_.emplace(key, at);
    }
    if (position < byPosition_.size()) {
        byPosition_[position] = at;
    } else {
        byPosition_.resize(position + 1, at);
    }
    return columns_[at];
}

void QVReportingConvoSessionSummary::add(const Dictionary& payload) {
    std::size_t position = 0;
    for (const auto& [key, value] : payload) {
        if (!omittedKey_.empty() && key == omittedKey_) {
            ++position;
            continue;
        }
        const std::size_t hint = position < byPosition_.size() ? byPosition_[position] : 0;
        Column& column = position < byPosition_.size() && columns_[hint].key == key
                             ? columns_[hint]
                             : columnFor(key, position);
        ++position;
        Cell cell{Cell::Kind::Other, 0, 0};
        switch (value.kind()) {
            case Value::Kind::String: {
                const std::string& s = *value.asString();
                cell = {Cell::Kind::Text, static_cast<std::uint32_t>(s.size()), text_.size()};
                text_ += s;
                break;
            }
            case Value::Kind::Int:
                cell = {Cell::Kind::Int, 0, static_cast<std::uint64_t>(*value.asInt64())};
                break;
            case Value::Kind::UInt:
                cell = {Cell::Kind::UInt, 0, *value.asUInt64()};
                break;
            case Value::Kind::Double:
                cell = {Cell::Kind::Double, 0, std::bit_cast<std::uint64_t>(*value.asDouble())};
                break;
            case Value::Kind::Bool:
                cell = {Cell::Kind::Bool, 0, value.boolValue() ? 1u : 0u};
                break;
            default:
                cell = {Cell::Kind::Other, 0, others_.size()};
                others_.push_back(value);
                break;
        }
        column.cells.push_back(cell);
    }
}

Dictionary QVReportingConvoSessionSummary::joined() const {
    Dictionary summary;
    summary.reserve(columns_.size());
    for (const Column& column : columns_) {
        std::string out;
        out.reserve(column.cells.size() * 8);
        char buffer[64];
        // Telemetry repeats itself: a number equal to the one before it in its column is copied
        // from that one's text rather than printed again.
        const Cell* previous = nullptr;
        std::size_t previousBegin = 0;
        for (const Cell& cell : column.cells) {
            if (previous) {
                out += ',';
            }
            const std::size_t begin = out.size();
            if (previous && cell.kind != Cell::Kind::Text && cell.kind != Cell::Kind::Other &&
                cell.kind == previous->kind && cell.bits == previous->bits) {
                out.append(out, previousBegin, begin - 1 - previousBegin);
            } else {
                // Numbers print as Value::description() prints them: the shortest text that
                // reads back as the same number.
                switch (cell.kind) {
                    case Cell::Kind::Text:
                        out.append(text_, cell.bits, cell.length);
                        break;
                    case Cell::Kind::Int:
                        out.append(buffer, fmt::format_to(buffer, FMT_COMPILE("{}"),
                                                          static_cast<std::int64_t>(cell.bits)));
                        break;
                    case Cell::Kind::UInt:
                        out.append(buffer, fmt::format_to(buffer, FMT_COMPILE("{}"), cell.bits));
                        break;
                    case Cell::Kind::Double:
                        out.append(buffer, fmt::format_to(buffer, FMT_COMPILE("{}"),
                                                          std::bit_cast<double>(cell.bits)));
                        break;
                    case Cell::Kind::Bool:
                        out += cell.bits ? '1' : '0';
                        break;
                    case Cell::Kind::Other:
                        out += others_[cell.bits].description();
                        break;
                }
            }
            previous = &cell;
            previousBegin = begin;
        }
        summary.set(column.key, std::move(out));
    }
    return summary;
}

}  // namespace qv

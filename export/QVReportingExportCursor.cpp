#include "QVReportingExportCursor.h"

#include <fstream>
#include <sstream>

#include <nlohmann/json.hpp>

#include "QVReportingExportFiles.h"

namespace qv::exporter {

QVReportingExportCursor QVReportingExportCursor::load(const std::filesystem::path& path,
                                                      std::string& error) {
    error.clear();
    QVReportingExportCursor cursor;
    std::error_code exists;
    if (!std::filesystem::exists(path, exists) && !exists) {
        return cursor;
    }
    std::ifstream in(path, std::ios::binary);
    std::stringstream text;
    text << in.rdbuf();
    if (!in) {
        error = "cannot read " + path.string();
        return cursor;
    }
    const auto json = nlohmann::json::parse(text.str(), nullptr, false);
    if (!json.is_object() || !json.contains("sinks") || !json["sinks"].is_object()) {
        error = path.string() + " is not a cursor (expected {\"sinks\": {NAME: SEQ}})";
        return cursor;
    }
    for (const auto& [sink, seq] : json["sinks"].items()) {
        if (!seq.is_number_unsigned()) {
            error = path.string() + ": the seq of " + sink + " is not a count";
            return {};
        }
        cursor.sinks_[sink] = seq.get<std::uint64_t>();
    }
    return cursor;
}

std::uint64_t QVReportingExportCursor::seq(std::string_view sink) const {
    const auto found = sinks_.find(sink);
    return found == sinks_.end() ? 0 : found->second;
}

void QVReportingExportCursor::advance(const std::string& sink, std::uint64_t seq) {
    auto& current = sinks_[sink];
    if (seq > current) {
        current = seq;
    }
}

std::string QVReportingExportCursor::toJson() const {
    nlohmann::ordered_json json;
    json["sinks"] = nlohmann::ordered_json::object();
    for (const auto& [sink, seq] : sinks_) {
        json["sinks"][sink] = seq;
    }
    return json.dump() + "\n";
}

std::string QVReportingExportCursor::save(const std::filesystem::path& path) const {
    return QVReportingExportWriteFileAtomically(path, toJson());
}

}  // namespace qv::exporter

#include "QVReportingExportStats.h"

#include <nlohmann/json.hpp>

namespace qv::exporter {

std::string QVReportingExportStats::toJson(double now) const {
    nlohmann::ordered_json json;
    json["device"] = device;
    json["stream"] = stream;
    json["servers"] = servers;
    json["connected"] = connected;
    json["stream_ready"] = streamReady;
    json["last_error"] = lastError;
    json["started"] = started;
    json["updated"] = now;
    auto& out = json["sinks"] = nlohmann::ordered_json::object();
    for (const auto& [name, c] : sinks) {
        out[name] = {{"sent", c.sent},
                     {"acknowledged", c.acknowledged},
                     {"duplicates", c.duplicates},
                     {"retried", c.retried},
                     {"failed", c.failed},
                     {"expired", c.expired},
                     {"cursor", c.cursor},
                     {"last_seq", c.lastSeq},
                     {"lag_lines", c.lastSeq > c.cursor ? c.lastSeq - c.cursor : 0},
                     {"lag_seconds", c.lagSeconds}};
    }
    return json.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace) + "\n";
}

}  // namespace qv::exporter

#include "QVReportingCtlMTXRecord.h"

#include <vector>

#include <fmt/format.h>

#include "values/Base64.h"
#include "workers/backends/mtx/AudioIssueDetected.h"

namespace qv::client {

namespace {

using Json = nlohmann::ordered_json;

// What a record formats, as nested JSON objects.
class JsonFormatter final : public mtxmetrics::TextFormatter {
  public:
    void beginObject(const char* name) override { open_.push_back({name, Json::object()}); }
    void formatInt32(const char* name, std::int32_t value) override { top()[name] = value; }
    void formatUInt64(const char* name, std::uint64_t value) override { top()[name] = value; }
    void formatString(const char* name, std::string_view bytes) override {
        top()[name] = std::string(bytes);  // bytes that are not UTF-8 are replaced when dumped
    }
    void endObject() override {
        auto [name, object] = std::move(open_.back());
        open_.pop_back();
        top()[name] = std::move(object);
    }

    Json& result() { return result_; }

  private:
    Json& top() { return open_.empty() ? result_ : open_.back().second; }

    std::vector<std::pair<std::string, Json>> open_;
    Json result_ = Json::object();
};

std::string hex(const Bytes& bytes, std::string_view separator) {
    std::string out;
    for (std::size_t i = 0; i < bytes.size(); ++i) {
        if (i > 0) {
            out += separator;
        }
        out += fmt::format("{:02x}", bytes[i]);
    }
    return out;
}

}  // namespace

std::string QVReportingCtlDecodeMTXRecord(Json& line, bool json) {
    std::optional<Bytes> bytes;
    if (auto record = line.find("record"); record != line.end() && record->is_string()) {
        bytes = QVReportingBase64Decode(record->get<std::string>());
    }
    if (!bytes) {
        if (json) {
            line["decoded"] = nullptr;
            line["decode_error"] = "record is not base64";
        }
        return "record is not base64";
    }
    const std::string_view wire(reinterpret_cast<const char*>(bytes->data()), bytes->size());
    mtxmetrics::Reader reader(wire);
    mtxmetrics::AudioIssueDetected record;
    const bool decoded = record.readFrom(reader);
    if (json) {
        if (decoded) {
            JsonFormatter formatter;
            record.formatText(formatter, "decoded");
            line["decoded"] = std::move(formatter.result()["decoded"]);
        } else {
            line["decoded"] = nullptr;
            line["decode_error"] = "record does not decode as AudioIssueDetected";
            line["record_hex"] = hex(*bytes, "");
        }
        return {};
    }
    line.erase("record");
    if (!decoded) {
        return "record does not decode: " + hex(*bytes, " ");
    }
    mtxmetrics::LineTextFormatter formatter;
    record.formatText(formatter, "AudioIssueDetected");
    return formatter.text();
}

}  // namespace qv::client

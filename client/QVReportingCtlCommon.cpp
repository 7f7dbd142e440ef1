// What qvreportctl's command groups share.
#include "QVReportingCtl.h"

#include <chrono>
#include <iostream>

#include <fmt/format.h>

#include "QVReportingCtlSupport.h"
#include "session/QVReportingVocabulary.h"

namespace qv::ctl {

std::string dump(const Json& json, int indent) {
    return json.dump(indent, ' ', false, Json::error_handler_t::replace);
}

void emit(const Json& json) {
    std::cout << dump(json) << std::endl;
}

double now() {
    using namespace std::chrono;
    return duration<double>(system_clock::now().time_since_epoch()).count();
}

std::int64_t reporterID(const std::string& text) {
    auto id = qv::client::QVReportingCtlParseReporterID(text);
    if (!id) {
        throw UsageError{"not a reporter ID (a signed 64-bit integer): " + text};
    }
    return *id;
}

Json parseJson(const std::string& text, const std::string& what) {
    Json json = Json::parse(text, nullptr, false);
    if (json.is_discarded()) {
        throw UsageError{what + " is not valid JSON: " + text +
                         " (strings need quotes: '\"text\"')"};
    }
    return json;
}

VariantMap variantMap(const std::string& text, const std::string& what) {
    qv::client::QVReportingJsonConversionOptions options;
    options.now = now();
    try {
        return qv::client::QVReportingJsonToVariantMap(parseJson(text, what), options, what);
    } catch (const qv::client::QVReportingJsonConversionError& e) {
        throw UsageError{e.what()};
    }
}

std::string serviceTypeText(std::uint16_t serviceType) {
    return fmt::format("{} ({})", serviceType,
                       qv::QVReportingUtilityGenerateServiceNameFromServiceType(serviceType));
}

std::string idsText(const std::vector<std::int64_t>& ids) {
    return ids.empty() ? "all started sessions" : fmt::format("[{}]", fmt::join(ids, ", "));
}

}  // namespace qv::ctl

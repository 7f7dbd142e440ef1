// qvreportctl defaults: the defaults store read and edited in place; a change to the daemon's
// own suite is announced to it.
#include <iostream>

#include <fmt/format.h>

#include "QVReportingCtl.h"
#include "values/ValueJson.h"

namespace qv::ctl {

namespace {

// The suite whose "device_name" the daemon watches, and the notification that tells it to look.
constexpr const char* kDaemonSuite = "com.korvane.qvsound";
constexpr const char* kDaemonSuiteChanged = "com.korvane.qvsound.reporting";

}  // namespace

DefaultsCommands::DefaultsCommands(const Options& options, BusCommands& bus)
    : options_(options), bus_(bus), store_(options.stateDir, [](const std::string& message) {
          std::cerr << "qvreportctl: defaults: " << message << std::endl;
      }) {}

int DefaultsCommands::read(const std::string& suite, const std::string& key) {
    if (key.empty()) {
        const Json values = qv::QVReportingDictionaryToJson(store_.values(suite));
        std::cout << (options_.json ? dump(values) : dump(values, 2)) << std::endl;
        return 0;
    }
    auto value = store_.value(suite, key);
    if (!value) {
        throw Failure{fmt::format("no key \"{}\" in {}", key, store_.pathForSuite(suite))};
    }
    std::cout << dump(qv::QVReportingValueToJson(*value)) << std::endl;
    return 0;
}

int DefaultsCommands::write(const std::string& suite, const std::string& key,
                            const std::string& text) {
    const Json json = parseJson(text, "the value");
    if (json.is_null()) {
        throw UsageError{"null cannot be stored; use `defaults delete` to remove a key"};
    }
    if (!store_.setValue(suite, key, qv::QVReportingValueFromJson(json))) {
        throw Failure{"could not write " + store_.pathForSuite(suite)};
    }
    return tellDaemon(suite);
}

int DefaultsCommands::remove(const std::string& suite, const std::string& key) {
    std::vector<std::string> keys;
    if (key.empty()) {
        for (const auto& [k, v] : store_.values(suite)) {
            keys.push_back(k);
        }
    } else {
        if (!store_.value(suite, key)) {
            throw Failure{fmt::format("no key \"{}\" in {}", key, store_.pathForSuite(suite))};
        }
        keys.push_back(key);
    }
    for (const auto& k : keys) {
        if (!store_.removeValue(suite, k)) {
            throw Failure{"could not write " + store_.pathForSuite(suite)};
        }
    }
    return tellDaemon(suite);
}

int DefaultsCommands::tellDaemon(const std::string& suite) {
    if (suite != kDaemonSuite) {
        return 0;
    }
    try {
        bus_.client().postNotification(kDaemonSuiteChanged, 0);
    } catch (const QVReportingClientError& e) {
        if (e.isDaemonNotRunning()) {
            std::cerr << "qvreportctl: saved; the daemon is not running and will read the "
                         "change when it starts"
                      << std::endl;
            return 0;
        }
        throw Failure{"saved, but telling the daemon failed: " + e.message()};
    }
    return 0;
}

}  // namespace qv::ctl

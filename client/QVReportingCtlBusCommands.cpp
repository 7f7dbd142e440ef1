// qvreportctl's bus commands: one per method of the reporting interface, the notification
// center and the guardrail counters.
#include <csignal>
#include <future>
#include <iostream>

#include <fmt/format.h>

#include "QVReportingCtl.h"
#include "QVReportingCtlSupport.h"
#include "QVReportingDBusNames.h"
#include "session/QVReportingVocabulary.h"

namespace qv::ctl {

QVReportingClient& BusCommands::client() {
    if (!client_) {
        client_ =
            QVReportingClient::connect(options_.bus, options_.transport, options_.directSocket);
    }
    return *client_;
}

void BusCommands::printBool(std::string_view op, std::int64_t id, bool result) {
    if (options_.json) {
        emit({{"op", op}, {"id", id}, {"result", result}});
    } else {
        std::cout << fmt::format("{} {}: {}", op, id, result) << std::endl;
    }
}

int BusCommands::create(const std::string& id) {
    const auto rid = reporterID(id);
    printBool("create", rid, client().createReportingSession(rid));
    return 0;
}

int BusCommands::setType(const std::string& id, const std::string& type) {
    const auto rid = reporterID(id);
    const auto serviceType = qv::client::QVReportingCtlParseServiceType(type);
    if (!serviceType) {
        throw UsageError{
            "not a service type (a number up to 65535 or a name such as "
            "longformaudio): " +
            type};
    }
    printBool("set-type", rid, client().setServiceType(*serviceType, rid));
    return 0;
}

int BusCommands::getType(const std::string& id) {
    const auto rid = reporterID(id);
    const auto serviceType = client().getServiceNameForReporterID(rid);
    if (options_.json) {
        emit({{"op", "get-type"},
              {"id", rid},
              {"serviceType", serviceType},
              {"serviceName",
               qv::QVReportingUtilityGenerateServiceNameFromServiceType(serviceType)}});
    } else {
        std::cout << fmt::format("service type of {}: {}", rid, serviceTypeText(serviceType))
                  << std::endl;
    }
    return 0;
}

int BusCommands::configure(const std::string& id, const std::string& config) {
    const auto rid = reporterID(id);
    const auto configuration = variantMap(config, "config");
    printBool("configure", rid, client().setConfiguration(configuration, rid));
    return 0;
}

int BusCommands::start(const std::string& id, bool create, const std::string& type,
                       const std::string& config) {
    const auto rid = reporterID(id);
    std::optional<std::uint16_t> serviceType;
    if (!type.empty()) {
        serviceType = qv::client::QVReportingCtlParseServiceType(type);
        if (!serviceType) {
            throw UsageError{"not a service type: " + type};
        }
    }
    std::optional<VariantMap> configuration;
    if (!config.empty()) {
        configuration = variantMap(config, "config");
    }
    create = create || serviceType || configuration;

    // Signals wait for sigtimedwait below; blocked before the client's thread exists, so
    // that thread inherits the mask and never takes them.
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);

    auto& c = client();
    if (create) {
        c.createReportingSession(rid);
        if (serviceType) {
            c.setServiceType(*serviceType, rid);
        }
        if (configuration) {
            c.setConfiguration(*configuration, rid);
        }
    }
    auto promise = std::make_shared<std::promise<std::optional<QVReportingClientError>>>();
    auto answered = promise->get_future();
    c.startReportingSessionAsync(rid, [promise](const QVReportingClientError* error, bool) {
        promise->set_value(error ? std::optional(*error) : std::nullopt);
    });
    if (create && !options_.json) {
        std::cerr << fmt::format("session {} started; Ctrl-C stops it", rid) << std::endl;
    }
    bool stopped = false;
    while (answered.wait_for(std::chrono::seconds(0)) != std::future_status::ready) {
        timespec interval{0, 100'000'000};
        if (sigtimedwait(&signals, nullptr, &interval) > 0 && !stopped) {
            stopped = true;
            c.stopReportingSession(rid);
            if (answered.wait_for(kStartReplyWait) != std::future_status::ready) {
                throw Failure{"the session stopped but its start call was never answered"};
            }
        }
    }
    if (auto error = answered.get()) {
        throw *error;
    }
    if (create) {
        c.destroyReportingSession(rid);
    }
    printBool("start", rid, true);
    return 0;
}

int BusCommands::send(const std::string& category, const std::string& type,
                      const std::string& payload, const std::vector<std::string>& ids) {
    const auto cat = qv::client::QVReportingCtlParseCategory(category);
    if (!cat) {
        throw UsageError{
            "not a category (a number or a name such as Playback or "
            "DSP_Setup): " +
            category};
    }
    const auto typ = qv::client::QVReportingCtlParseType(type);
    if (!typ) {
        throw UsageError{
            "not an event type (a number up to 65535 or a name such as "
            "Start): " +
            type};
    }
    std::vector<std::int64_t> rids;
    for (const auto& id : ids) {
        rids.push_back(reporterID(id));
    }
    client().sendMessage(variantMap(payload, "payload"), *cat, *typ, rids);
    if (options_.json) {
        emit({{"op", "send"}, {"category", *cat}, {"type", *typ}, {"ids", rids}});
    } else {
        std::cout << fmt::format("sent {}/{} to {}", qv::QVReportingUtilityCategoryString(*cat),
                                 qv::QVReportingUtilityTypeString(*typ), idsText(rids))
                  << std::endl;
    }
    return 0;
}

int BusCommands::stop(const std::string& id) {
    const auto rid = reporterID(id);
    printBool("stop", rid, client().stopReportingSession(rid));
    return 0;
}

int BusCommands::destroy(const std::string& id) {
    const auto rid = reporterID(id);
    printBool("destroy", rid, client().destroyReportingSession(rid));
    return 0;
}

int BusCommands::valid(const std::string& id) {
    const auto rid = reporterID(id);
    const Json reply = qv::client::QVReportingVariantMapToJson(client().reporterIDValid(rid));
    if (options_.json) {
        emit({{"op", "valid"}, {"id", rid}, {"result", reply}});
        return 0;
    }
    const auto found = reply.value(qv::dbus::kReporterProxyKeyReporterID, Json(0));
    const auto serviceType = reply.value(qv::dbus::kReporterProxyKeyServiceType, Json(65535));
    if (found == 0) {
        std::cout << fmt::format("reporter {}: unknown", rid) << std::endl;
    } else {
        std::cout << fmt::format("reporter {}: service type {}", rid,
                                 serviceType.is_number_unsigned()
                                     ? serviceTypeText(serviceType.get<std::uint16_t>())
                                     : dump(serviceType))
                  << std::endl;
    }
    return 0;
}

int BusCommands::list() {
    const auto ids = client().getAllReporters();
    if (options_.json) {
        emit({{"op", "list"}, {"result", ids}});
    } else {
        for (auto id : ids) {
            std::cout << id << '\n';
        }
        std::cout.flush();
    }
    return 0;
}

int BusCommands::kill() {
    client().killService();
    if (options_.json) {
        emit({{"op", "kill"}, {"result", true}});
    } else {
        std::cout << "the daemon has exited" << std::endl;
    }
    return 0;
}

int BusCommands::stats() {
    const Json stats = qv::client::QVReportingVariantMapToJson(client().getStats());
    if (options_.json) {
        emit(stats);
        return 0;
    }
    for (const auto& [key, value] : stats.items()) {
        std::cout << key << ": " << dump(value) << '\n';
    }
    std::cout.flush();
    return 0;
}

int BusCommands::notifyPost(const std::string& name, const std::string& text) {
    const auto state = qv::client::QVReportingCtlParseUnsigned(text);
    if (!state) {
        throw UsageError{"not a state (an unsigned 64-bit number): " + text};
    }
    client().postNotification(name, *state);
    if (options_.json) {
        emit({{"op", "notify-post"}, {"name", name}, {"state", *state}});
    } else {
        std::cout << fmt::format("posted {} = {}", name, *state) << std::endl;
    }
    return 0;
}

int BusCommands::notifyGet(const std::string& name) {
    const auto state = client().getNotificationState(name);
    if (options_.json) {
        emit({{"op", "notify-get"}, {"name", name}, {"state", state}});
    } else {
        std::cout << state << std::endl;
    }
    return 0;
}

}  // namespace qv::ctl

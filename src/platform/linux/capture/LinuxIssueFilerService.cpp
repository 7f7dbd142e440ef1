#include "platform/linux/capture/LinuxIssueFilerService.h"

#include <sys/socket.h>
#include <sys/stat.h>

#include <cerrno>
#include <system_error>

#include <fmt/format.h>
#include <systemd/sd-bus.h>

#include "platform/linux/system/ErrnoText.h"
#include "values/Markup.h"
#include "values/Utf8.h"

namespace qv {

namespace {

constexpr const char* kNotificationsName = "org.freedesktop.Notifications";
constexpr const char* kNotificationsPath = "/org/freedesktop/Notifications";
constexpr const char* kNotificationsInterface = "org.freedesktop.Notifications";
constexpr const char* kAppName = "qvreportd";
constexpr const char* kAppIcon = "dialog-warning";
// Normal urgency: the person is asked, not interrupted.
constexpr std::uint8_t kUrgencyNormal = 1;
// Let the notification server choose how long the prompt stays.
constexpr std::int32_t kServerDefaultExpiry = -1;

// The bus takes only valid UTF-8: bad bytes become U+FFFD rather than losing the prompt.
std::string validUtf8(std::string_view text) {
    std::string out;
    out.reserve(text.size());
    for (std::size_t i = 0; i < text.size();) {
        const std::size_t n = QVReportingUtf8SequenceLength(text, i);
        if (n == 0) {
            out += "\xEF\xBF\xBD";
            ++i;
        } else {
            out.append(text.substr(i, n));
            i += n;
        }
    }
    return out;
}

struct BusDeleter {
    // No flush: the reply is in, and flushing a connection that never came up waits for its
    // authentication without a bound.
    void operator()(sd_bus* bus) const { sd_bus_close_unref(bus); }
};
struct MessageDeleter {
    void operator()(sd_bus_message* m) const { sd_bus_message_unref(m); }
};
using BusPtr = std::unique_ptr<sd_bus, BusDeleter>;
using MessagePtr = std::unique_ptr<sd_bus_message, MessageDeleter>;

struct NotifyResult {
    std::optional<std::uint32_t> id;
    std::string reason;  // why there is no id
};

// Brings the connection up (authentication and Hello) by the deadline. sd_bus_call would wait
// for that without a bound of its own, so a bus that accepts the connection and then says nothing
// would hold the thread far beyond the time-out.
std::optional<std::string> connectBy(sd_bus* bus, const std::string& address,
                                     std::chrono::steady_clock::time_point deadline) {
    for (;;) {
        int r = sd_bus_is_ready(bus);
        if (r > 0) {
            return std::nullopt;
        }
        if (r == 0) {
            r = sd_bus_process(bus, nullptr);
            if (r > 0) {
                continue;
            }
        }
        if (r < 0) {
            return fmt::format("cannot reach the session bus at {}: {}", address, errnoText(-r));
        }
        const auto left = std::chrono::duration_cast<std::chrono::microseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            return fmt::format("the session bus at {} did not let us in in time", address);
        }
        r = sd_bus_wait(bus, static_cast<std::uint64_t>(left.count()));
        if (r < 0) {
            return fmt::format("cannot reach the session bus at {}: {}", address, errnoText(-r));
        }
    }
}

// One Notify call on a fresh connection: prompts are rare, and a fresh connection survives the
// session bus going and coming back. The whole exchange ends within the time-out.
NotifyResult notify(const std::string& address, const std::string& summary, const std::string& body,
                    std::chrono::milliseconds timeout) {
    const auto deadline = std::chrono::steady_clock::now() + timeout;
    sd_bus* raw = nullptr;
    int r = sd_bus_new(&raw);
    if (r < 0) {
        return {std::nullopt, "cannot make a bus connection: " + errnoText(-r)};
    }
    BusPtr bus(raw);
    if ((r = sd_bus_set_address(bus.get(), address.c_str())) < 0 ||
        (r = sd_bus_set_bus_client(bus.get(), 1)) < 0 ||
        (r = sd_bus_set_method_call_timeout(
             bus.get(), static_cast<std::uint64_t>(timeout.count()) * 1000)) < 0 ||
        (r = sd_bus_start(bus.get())) < 0) {
        return {std::nullopt,
                fmt::format("cannot reach the session bus at {}: {}", address, errnoText(-r))};
    }
    if (auto error = connectBy(bus.get(), address, deadline)) {
        return {std::nullopt, *error};
    }
    sd_bus_message* m = nullptr;
    r = sd_bus_message_new_method_call(bus.get(), &m, kNotificationsName, kNotificationsPath,
                                       kNotificationsInterface, "Notify");
    if (r < 0) {
        return {std::nullopt, "cannot build the notification: " + errnoText(-r)};
    }
    MessagePtr call(m);
    // Only a notification service that already runs is asked; none is started for the daemon.
    sd_bus_message_set_auto_start(call.get(), 0);
    if ((r = sd_bus_message_append(call.get(), "susss", kAppName, 0u, kAppIcon, summary.c_str(),
                                   body.c_str())) < 0 ||
        (r = sd_bus_message_append(call.get(), "as", 0)) < 0 ||
        (r = sd_bus_message_append(call.get(), "a{sv}", 1, "urgency", "y", kUrgencyNormal)) < 0 ||
        (r = sd_bus_message_append(call.get(), "i", kServerDefaultExpiry)) < 0) {
        return {std::nullopt, "cannot build the notification: " + errnoText(-r)};
    }
    sd_bus_error error = SD_BUS_ERROR_NULL;
    sd_bus_message* reply = nullptr;
    const auto left =
        std::max<std::int64_t>(1, std::chrono::duration_cast<std::chrono::microseconds>(
                                      deadline - std::chrono::steady_clock::now())
                                      .count());
    r = sd_bus_call(bus.get(), call.get(), static_cast<std::uint64_t>(left), &error, &reply);
    MessagePtr answer(reply);
    if (r < 0) {
        std::string reason;
        if (sd_bus_error_has_names(&error, SD_BUS_ERROR_SERVICE_UNKNOWN,
                                   SD_BUS_ERROR_NAME_HAS_NO_OWNER, nullptr)) {
            reason = "no notification service on the session bus";
        } else if (r == -ETIMEDOUT || sd_bus_error_has_names(&error, SD_BUS_ERROR_NO_REPLY,
                                                             SD_BUS_ERROR_TIMEOUT, nullptr)) {
            reason = fmt::format("the notification service did not answer within {} ms",
                                 timeout.count());
        } else if (sd_bus_error_is_set(&error)) {
            reason = fmt::format("the notification service refused: {} {}", error.name,
                                 error.message ? error.message : "");
        } else {
            reason = fmt::format("cannot reach the notification service at {}: {}", address,
                                 errnoText(-r));
        }
        sd_bus_error_free(&error);
        return {std::nullopt, reason};
    }
    std::uint32_t id = 0;
    r = sd_bus_message_read(answer.get(), "u", &id);
    if (r < 0) {
        return {std::nullopt, "the notification service answered with something else"};
    }
    return {id, ""};
}

}  // namespace

LinuxIssueFilerService::LinuxIssueFilerService(std::unique_ptr<JsonlSink> sink, Options options)
    : sink_(std::move(sink)),
      options_(std::move(options)),
      thread_(std::max<std::size_t>(options_.maxPendingPrompts, 1),
              [this](Prompt& prompt) { show(prompt); }) {}

LinuxIssueFilerService::~LinuxIssueFilerService() {
    // Prompts still waiting are recorded as not shown rather than each waiting out its time-out:
    // the daemon has a few seconds to stop.
    stopping_.store(true);
}

std::optional<std::string> LinuxIssueFilerService::sessionBusAddressFor(
    const char* environmentAddress, unsigned uid, const std::string& runtimeRoot) {
    if (environmentAddress != nullptr && *environmentAddress != '\0') {
        return std::string(environmentAddress);
    }
    const std::string socketPath = fmt::format("{}/{}/bus", runtimeRoot, uid);
    struct stat st {};
    if (::stat(socketPath.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) {
        return "unix:path=" + socketPath;
    }
    return std::nullopt;
}

void LinuxIssueFilerService::createDraft(const IssueDraft& draft, std::string_view processName,
                                         std::string_view displayReason, Completion completion) {
    std::int64_t number = 0;
    {
        std::lock_guard lock(mutex_);
        number = nextDraft_++;
    }
    Array extensions;
    extensions.reserve(draft.diagnosticExtensionIdentifiers.size());
    for (const auto& identifier : draft.diagnosticExtensionIdentifiers) {
        extensions.emplace_back(identifier);
    }
    Dictionary line{
        {"op", "draft"},
        {"draft", number},
        {"processName", processName},
        {"displayReason", displayReason},
        {"title", draft.title},
        {"problemDescription", draft.problemDescription},
        {"component", Dictionary{{"name", draft.component.name},
                                 {"version", draft.component.version},
                                 {"identifier", draft.component.identifier}}},
        {"reproducibility", draft.reproducibility},
        {"classification", draft.classification},
        {"diagnosticExtensionIdentifiers", std::move(extensions)},
    };
    std::optional<std::string> error;
    if (!sink_->append(std::move(line))) {
        error = fmt::format("the {} sink is full; draft {} dropped", kSinkName, number);
    }

    // Held here as well: a prompt the thread refuses is destroyed, and its completion must still
    // run.
    auto answer = std::make_shared<Completion>(std::move(completion));
    Prompt prompt;
    prompt.number = number;
    prompt.summary = validUtf8(draft.title);
    const std::string process =
        processName.empty() ? std::string("a process") : std::string(processName);
    // Bodies may be read as simple markup; text from clients is shown as text.
    prompt.body = QVReportingEscapeMarkup(validUtf8(
        fmt::format("{}: {}. A bug report draft is waiting to be filed.", process, displayReason)));
    prompt.completion = answer;
    prompt.error = error;
    if (thread_.push(std::move(prompt))) {
        promptsOverflowing_.store(false, std::memory_order_relaxed);
        return;
    }
    const std::string reason =
        fmt::format("{} prompts are already waiting", options_.maxPendingPrompts);
    recordPrompt(number, std::nullopt, reason);
    if (!promptsOverflowing_.exchange(true, std::memory_order_relaxed) && options_.notice) {
        options_.notice("issue filer: no prompt shown: " + reason);
    }
    if (*answer) {
        (*answer)(error);
    }
}

void LinuxIssueFilerService::show(Prompt& prompt) {
    if (stopping_.load()) {
        recordPrompt(prompt.number, std::nullopt, "the service stopped first");
    } else if (!options_.sessionBusAddress) {
        const std::string reason = "no session bus";
        recordPrompt(prompt.number, std::nullopt, reason);
        noteCause("issue filer: no session bus; drafts are recorded in the sink only");
    } else {
        const NotifyResult result = notify(*options_.sessionBusAddress, prompt.summary, prompt.body,
                                           options_.notifyTimeout);
        recordPrompt(prompt.number, result.id, result.reason);
        if (result.id) {
            lastCause_.clear();
        } else {
            noteCause("issue filer: no prompt shown: " + result.reason);
        }
    }
    if (prompt.completion && *prompt.completion) {
        (*prompt.completion)(prompt.error);
    }
}

void LinuxIssueFilerService::recordPrompt(std::int64_t number,
                                          const std::optional<std::uint32_t>& notification,
                                          const std::string& reason) {
    Dictionary line{{"op", "prompt"}, {"draft", number}, {"shown", notification.has_value()}};
    if (notification) {
        line.set("notification", *notification);
    } else {
        line.set("reason", reason);
    }
    sink_->append(std::move(line));
}

void LinuxIssueFilerService::noteCause(const std::string& cause) {
    if (cause == lastCause_) {
        return;
    }
    lastCause_ = cause;
    if (options_.notice) {
        options_.notice(cause);
    }
}

void LinuxIssueFilerService::flush() {
    thread_.flush();
    sink_->flush();
}

}  // namespace qv

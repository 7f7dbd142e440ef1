#include "platform/linux/sinks/LinuxConvoService.h"

#include <unistd.h>

#include <fmt/format.h>

#include "platform/PreferenceStore.h"

namespace qv {

class LinuxConvoService::Session final : public ConvoSession {
  public:
    Session(LinuxConvoService& service, std::int64_t number, Value sessionID)
        : service_(service), number_(number), sessionID_(std::move(sessionID)) {}

    void startConfiguration(ConfigurationCompletion completion) override {
        // Read on the service's thread, so the answer reflects the suite when it is given.
        service_.post([&service = service_, completion = std::move(completion)] {
            completion(service.currentBackends());
        });
    }

    std::optional<std::string> sendMessage(std::uint16_t category, std::uint16_t type,
                                           const Dictionary& payload) override {
        Dictionary line;
        line.reserve(6);
        line.set("op", "message");
        line.set("session", number_);
        line.set("sessionID", sessionID_);
        line.set("category", category);
        line.set("type", type);
        line.set("payload", payload);
        if (!service_.sink_->append(std::move(line))) {
            return fmt::format("the {} sink is full; message dropped", kSinkName);
        }
        return std::nullopt;
    }

    void flush() override {
        Dictionary line;
        line.reserve(3);
        line.set("op", "flush");
        line.set("session", number_);
        line.set("sessionID", sessionID_);
        service_.sink_->append(std::move(line));
    }

    std::string description() const override {
        return fmt::format("<ConvoSession {} sessionID={}>", number_, sessionID_.description());
    }

  private:
    LinuxConvoService& service_;
    const std::int64_t number_;
    const Value sessionID_;
};

LinuxConvoService::LinuxConvoService(const PreferenceStore& preferences,
                                     std::unique_ptr<JsonlSink> sink)
    : preferences_(preferences),
      sink_(std::move(sink)),
      thread_(kMaxPendingCompletions, [](std::function<void()>& task) { task(); }) {}

LinuxConvoService::~LinuxConvoService() = default;

bool LinuxConvoService::post(std::function<void()> task) {
    return thread_.push(std::move(task));
}

std::optional<std::string> LinuxConvoService::newHierarchyTokenFromParentToken(
    const std::optional<std::string>& parent) {
    const auto enabled = preferences_.value(kSuite, kEnabledKey);
    if (enabled && !enabled->boolValue()) {
        return std::nullopt;
    }
    const std::uint64_t n = nextToken_.fetch_add(1, std::memory_order_relaxed);
    std::string token = fmt::format("convo-{}-{}", ::getpid(), n);
    if (parent) {
        token = *parent + "/" + token;
    }
    return token;
}

std::shared_ptr<ConvoSession> LinuxConvoService::createSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo,
    const std::optional<std::vector<std::string>>& /*frameworksToCheck*/) {
    const std::int64_t number = nextSession_.fetch_add(1, std::memory_order_relaxed);
    const Value* id = sessionInfo.find(convo::kSessionInfoSessionID);
    Dictionary line;
    line.reserve(4);
    line.set("op", "session");
    line.set("session", number);
    line.set("sessionInfo", sessionInfo);
    line.set("userInfo", userInfo);
    sink_->append(std::move(line));
    return std::make_shared<Session>(*this, number, id ? *id : Value());
}

std::optional<std::vector<std::string>> LinuxConvoService::currentBackends() const {
    const auto configured = preferences_.value(kSuite, kBackendsKey);
    if (!configured) {
        return std::vector<std::string>{"jsonl"};
    }
    std::vector<std::string> backends;
    if (const Array* list = configured->asArray()) {
        for (const Value& v : *list) {
            if (const std::string* name = v.asString(); name && !name->empty()) {
                backends.push_back(*name);
            }
        }
    }
    if (backends.empty()) {
        return std::nullopt;
    }
    return backends;
}

}  // namespace qv

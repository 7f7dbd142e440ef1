// Helpers shared by the tests of sessions and their workers.
#pragma once

#include <gtest/gtest.h>

#include <cctype>
#include <filesystem>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "fakes/FakePlatform.h"
#include "fakes/MemoryLogSink.h"
#include "session/QVReportingSession.h"
#include "session/QVReportingSessionWorker.h"
#include "session/QVReportingUtility.h"
#include "session/QVReportingWorkerRegistry.h"

namespace qv::test {

using Messages = std::vector<std::shared_ptr<QVReportingSessionMessage>>;

// Registers only the worker classes W, in that order, on a fresh reading of the build kind, and
// leaves no class registered behind it.
template <typename... W>
class ScopedWorkerClasses {
  public:
    ScopedWorkerClasses() {
        QVReportingUtilityTEST_resetInternalBuild();
        QVReportingWorkerRegistry::TEST_reset({&makeWorkerClass<W>()...});
    }
    ~ScopedWorkerClasses() {
        QVReportingWorkerRegistry::TEST_reset({});
        QVReportingUtilityTEST_resetInternalBuild();
    }
    ScopedWorkerClasses(const ScopedWorkerClasses&) = delete;
    ScopedWorkerClasses& operator=(const ScopedWorkerClasses&) = delete;
};

// Switches the device's build kind and has the next question read it afresh.
inline void setInternalBuild(FakeDeviceInformation& device, bool internal) {
    device.internalBuild = internal;
    QVReportingUtilityTEST_resetInternalBuild();
}

inline std::shared_ptr<QVReportingSessionMessage> message(
    Dictionary payload, AudioEventCategory c = category::kPlayback,
    AudioEventType t = type::kStart) {
    return std::make_shared<QVReportingSessionMessage>(std::move(payload), c, t);
}

inline void send(QVReportingSession& session, Dictionary payload, AudioEventCategory c,
                 AudioEventType t) {
    session.sendMessage(message(std::move(payload), c, t));
}

// What a category logged, each text after its "%25s:%-5d " prefix (file name, colon, line number
// in five columns, blank); every such line must be an error.
inline std::vector<std::string> errorTexts(const MemoryLogSink& log, std::string_view category) {
    std::vector<std::string> texts;
    for (const auto& line : log.lines()) {
        if (line.category == category) {
            EXPECT_EQ(line.level, LogLevel::Error) << line.text;
            texts.push_back(line.text.substr(line.text.find(".cpp:") + 5 + 6));
        }
    }
    return texts;
}

// The session's first worker of class W, or null.
template <typename W>
std::shared_ptr<W> workerOf(const QVReportingSession& session) {
    for (const auto& w : session.messageWorkers()) {
        if (auto found = std::dynamic_pointer_cast<W>(w)) {
            return found;
        }
    }
    return nullptr;
}

inline std::vector<std::string> keysOf(const Dictionary& d) {
    std::vector<std::string> keys;
    for (const auto& entry : d) {
        keys.push_back(entry.first);
    }
    return keys;
}

// The shape of a result file's leading local time, "yyyyMMdd-HHmmss" and its zone ("+hhmm" or
// "-hhmm"): every digit a 9 and every "-" a "+", so that it reads "99999999+999999+9999".
inline std::string timeStampShape(const std::string& fileName) {
    std::string shape = fileName.substr(0, 20);
    for (char& c : shape) {
        c = std::isdigit(static_cast<unsigned char>(c)) ? '9' : c == '-' ? '+' : c;
    }
    return shape;
}

// The entries of a directory; none when it does not exist.
inline std::vector<std::filesystem::path> filesIn(const std::filesystem::path& directory) {
    std::vector<std::filesystem::path> found;
    std::error_code ec;
    for (const auto& entry : std::filesystem::directory_iterator(directory, ec)) {
        found.push_back(entry.path());
    }
    return found;
}

// A client message at time t ("qvreporting_timestamp"; none when t is null).
inline std::shared_ptr<QVReportingSessionMessage> at(Value t, Dictionary payload) {
    if (!t.isNull()) {
        payload.set("qvreporting_timestamp", t);
    }
    return QVReportingSessionMessage::initWithMessage(payload, category::kPlayback, type::kGeneric);
}
inline std::shared_ptr<QVReportingSessionMessage> set(Value t, const char* key, Value v) {
    return at(t, {{key, v}});
}

// A session set up as a client's calls would: only what is given is set, in this order.
struct SessionSetup {
    ReporterID id = 7;
    std::vector<std::int64_t> pids = {1234};
    std::optional<AudioServiceType> serviceType = std::nullopt;
    std::optional<Dictionary> configuration = std::nullopt;
    const char* processName = nullptr;
    bool single = false;
    bool start = false;
};
inline std::shared_ptr<QVReportingSession> makeSession(const Platform& platform, SessionSetup s) {
    auto session = QVReportingSession::initWithID(platform, s.id, std::move(s.pids));
    if (s.serviceType)
        session->setServiceType(*s.serviceType);
    if (s.configuration)
        session->updateConfigurationWithContentsOfConfiguration(&*s.configuration);
    if (s.processName)
        session->setClientProcessName(s.processName);
    if (s.single)
        session->setIsSingleMessageSession(true);
    if (s.start)
        session->start();
    return session;
}

inline std::shared_ptr<QVReportingSession> sessionWith(const Platform& platform,
                                                       const Dictionary& previous) {
    auto session = QVReportingSession::initWithID(platform, 7, {1});
    session->previousValues() = previous;
    return session;
}

// Accessory information whose elements name their position and device ("e11-K1"); the model,
// device key and pairing days sit where the report reads them.
inline Dictionary accessory(const std::string& key, std::size_t count = 15,
                            const std::string& model = "M4801") {
    Array versions;
    for (std::size_t i = 0; i < count; ++i) {
        versions.emplace_back("e" + std::to_string(i) + "-" + key);
    }
    versions[1] = model;
    versions[3] = key;
    if (count > 14) {
        versions[13] = 259200;  // day 3 of the epoch week
        versions[14] = 604799;  // day 6
    }
    return Dictionary{{"TELPVersionInfo", Value(std::move(versions))},
                      {"CaseInfo", Dictionary{{"CaseInfoVersion", "case-1"}}}};
}

inline Dictionary withElement(Dictionary info, std::size_t element, Value value) {
    Array versions = *info.find("TELPVersionInfo")->asArray();
    versions[element] = std::move(value);
    info.set("TELPVersionInfo", std::move(versions));
    return info;
}

}  // namespace qv::test

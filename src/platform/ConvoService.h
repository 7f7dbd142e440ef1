// The conversation-quality reporting service (Convo): a client opens a reporting session under a
// hierarchy token, describes it with a session-info and a user-info dictionary, asks which
// backends will receive it, then sends it messages (a 16-bit category, a 16-bit type and a
// payload) and flushes it. The session worker mirrors every reporting session into one; the
// accessory registration worker publishes its weekly report through one.
//
// Thread safety: every member may be called from any thread; a session's calls are made in the
// order its client wants them carried out. The configuration completion runs on a thread of the
// service's own, never on the caller's, and may come after the caller stopped waiting for it.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "values/Value.h"

namespace qv {

// Keys of the session-info and user-info dictionaries: the service's published constants.
namespace convo {
// Session info.
inline constexpr std::string_view kSessionInfoClientType = "ClientType";
inline constexpr std::string_view kSessionInfoClientVersion = "ClientVersion";
inline constexpr std::string_view kSessionInfoSessionID = "SessionID";
inline constexpr std::string_view kSessionInfoBatchEvent = "BatchEvent";
inline constexpr std::string_view kSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr std::string_view kSessionInfoContainsRealtimeEvents = "ContainsRealtimeEvents";
inline constexpr std::string_view kSessionInfoClientBundleID = "ClientBundleID";
// User info.
inline constexpr std::string_view kUserInfoClientName = "ClientName";
inline constexpr std::string_view kUserInfoServiceName = "ServiceName";
}  // namespace convo

// One reporting session of the service.
class ConvoSession {
  public:
    // The backends that will receive the session, or nothing when there are none.
    using ConfigurationCompletion =
        std::function<void(const std::optional<std::vector<std::string>>& backends)>;

    virtual ~ConvoSession() = default;

    // Asks which backends will receive the session; completion runs once, on the service's
    // thread.
    virtual void startConfiguration(ConfigurationCompletion completion) = 0;
    // Sends one message; nothing on success, else a readable description of the error.
    virtual std::optional<std::string> sendMessage(std::uint16_t category, std::uint16_t type,
                                                   const Dictionary& payload) = 0;
    // Hands on what the session still holds.
    virtual void flush() = 0;
    // The session as log lines print it.
    virtual std::string description() const = 0;
};

class ConvoService {
  public:
    virtual ~ConvoService() = default;

    // A new hierarchy token under parent (callers give none): an opaque text that goes into the
    // session info, or nothing when the service is unavailable.
    virtual std::optional<std::string> newHierarchyTokenFromParentToken(
        const std::optional<std::string>& parent) = 0;
    // A new session described by sessionInfo and userInfo (keys of convo::); frameworksToCheck
    // is given as nothing by every caller. Never null.
    virtual std::shared_ptr<ConvoSession> createSession(
        const Dictionary& sessionInfo, const Dictionary& userInfo,
        const std::optional<std::vector<std::string>>& frameworksToCheck) = 0;
};

}  // namespace qv

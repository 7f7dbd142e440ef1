// Named system notifications that carry a 64-bit state: a poster sets a name's state and every
// registration for that name is told. The daemon both listens (ringer state, feature changes) and
// posts ("com.korvane.qvsound.dropped-spinlog").
//
// Thread safety: every member may be called from any thread. Handlers run on the task runner
// given at registration, never on the poster's thread, so a handler may call back in.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace qv {

class NotificationCenter {
  public:
    using Token = std::int32_t;
    // Runs a task later on the registrant's own thread or queue.
    using TaskRunner = std::function<void(std::function<void()>)>;
    using Handler = std::function<void(Token token)>;

    virtual ~NotificationCenter() = default;

    // Registers for a name; the handler runs through runner after each post of that name.
    // Returns a positive token, or nothing when the registration failed.
    virtual std::optional<Token> registerNotification(std::string_view name, TaskRunner runner,
                                                      Handler handler) = 0;
    // Ends a registration; its handler is not run again. Unknown tokens are ignored.
    virtual void cancel(Token token) = 0;
    // The state last posted under the name the token was registered for (0 when none was
    // posted), or nothing for an unknown token.
    virtual std::optional<std::uint64_t> getState(Token token) const = 0;
    // The state last posted under a name (0 when none was posted).
    virtual std::uint64_t stateOf(std::string_view name) const = 0;
    // Sets the name's state and tells every registration for it.
    virtual void post(std::string_view name, std::uint64_t state) = 0;
};

}  // namespace qv

// The notification center of the daemon's own process: a table from name to 64-bit state, and
// registrations that are told when their name is posted. The bus object of the notification
// center (Post, GetState, the Posted signal) sits on top of it, so other processes post and read
// through this table too.
//
// Posting sets the state and hands each matching registration's handler to that registration's
// task runner, outside the center's lock; a handler may therefore call back in, even post. A
// handler whose registration is cancelled before its task runs is not called.
//
// Clients choose the names they post, so the table is bounded: once it holds maxNames names, a
// post of a further name that no registration watches is passed on (post observer) but its state
// is not kept, and droppedStates() counts it; the same goes for an unwatched name longer than
// kMaxNameLength bytes. Names that a registration watches are always kept.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <atomic>
#include <cstddef>
#include <map>
#include <memory>
#include <mutex>

#include "platform/NotificationCenter.h"

namespace qv {

class LinuxNotificationCenter final : public NotificationCenter {
  public:
    using PostObserver = std::function<void(const std::string& name, std::uint64_t state)>;

    static constexpr std::size_t kDefaultMaxNames = 4096;
    // Real notification names are reverse-DNS strings of a few dozen bytes.
    static constexpr std::size_t kMaxNameLength = 1024;

    explicit LinuxNotificationCenter(std::size_t maxNames = kDefaultMaxNames);

    LinuxNotificationCenter(const LinuxNotificationCenter&) = delete;
    LinuxNotificationCenter& operator=(const LinuxNotificationCenter&) = delete;

    // Fails (nothing) when runner or handler is empty, or when tokens are used up.
    std::optional<Token> registerNotification(std::string_view name, TaskRunner runner,
                                              Handler handler) override;
    void cancel(Token token) override;
    std::optional<std::uint64_t> getState(Token token) const override;
    std::uint64_t stateOf(std::string_view name) const override;
    void post(std::string_view name, std::uint64_t state) override;

    // Called after every post, on the posting thread, after the handlers were handed to their
    // runners and outside the center's lock. Replaces any earlier observer; empty removes it.
    void setPostObserver(PostObserver observer);

    // Posts whose state was not kept because the table of names was full.
    std::uint64_t droppedStates() const { return droppedStates_.load(std::memory_order_relaxed); }

  private:
    struct Registration {
        std::string name;
        TaskRunner runner;
        std::shared_ptr<const Handler> handler;
        // Cleared by cancel; a task already handed to the runner checks it before calling.
        std::shared_ptr<std::atomic<bool>> live;
    };

    bool watchedLocked(std::string_view name) const;

    const std::size_t maxNames_;
    mutable std::mutex mutex_;
    std::map<std::string, std::uint64_t, std::less<>> states_;  // guarded by mutex_
    std::map<Token, Registration> registrations_;               // guarded by mutex_
    Token lastToken_ = 0;                                       // guarded by mutex_
    std::shared_ptr<const PostObserver> postObserver_;          // guarded by mutex_
    std::atomic<std::uint64_t> droppedStates_{0};
};

}  // namespace qv

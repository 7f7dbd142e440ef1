#include "service/QVReportingDBusServer.h"

#include <poll.h>
#include <pthread.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <time.h>
#include <unistd.h>

#include <cstring>
#include <future>
#include <stdexcept>

#include "QVReportingDBusNames.h"
#include "platform/linux/system/LinuxNotificationCenter.h"
#include "service/QVReportingDirectSocket.h"
#include "session/QVReportingLog.h"

namespace qv {

namespace {

// Calls read from one connection before the next has its turn: long enough to keep a pipelining
// client's socket reads large, short enough that no connection waits behind a flood.
constexpr int kCallsPerTurn = 64;

// Replies a direct connection may leave unread (queued once the socket's own buffer is full)
// before it is closed: a client that stops reading its replies would otherwise grow the daemon
// without bound. On the bus, the broker plays this part.
constexpr std::uint64_t kMaxUnreadReplies = 1024;

}  // namespace

QVReportingDBusServer::QVReportingDBusServer(sd_bus* bus, QVReportingService& service,
                                             LinuxNotificationCenter* notifications,
                                             std::unique_ptr<QVReportingDirectSocket> direct)
    : service_(service),
      notifications_(notifications),
      limits_(service.limits()),
      budget_{limits_.maxPayloadBytes, limits_.maxPayloadValues, limits_.maxPayloadDepth},
      lifeline_(std::make_shared<Lifeline>()),
      direct_(std::move(direct)) {
    lifeline_->server = this;
    bus_.server = this;
    bus_.bus = bus;
    wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    if (wakeFd_ < 0) {
        sd_bus_flush_close_unref(bus);
        throw std::runtime_error("eventfd failed");
    }
    sd_id128_randomize(&serverID_);
}

QVReportingDBusServer::~QVReportingDBusServer() {
    {
        std::lock_guard lock(lifeline_->mutex);
        lifeline_->server = nullptr;
    }
    stop();
    closeConnections();  // when the loop never ran
    sd_bus_flush_close_unref(bus_.bus);
    ::close(wakeFd_);
}

void QVReportingDBusServer::stop() {
    if (notifications_) {
        notifications_->setPostObserver(nullptr);
    }
    if (loopThread_.joinable()) {
        // The loop ends, and its thread lets go of what it served (closeConnections()).
        post([this] { stopping_ = true; });
        loopThread_.join();
    }
}

void QVReportingDBusServer::start() {
    if (!registerObjects(bus_)) {
        throw std::runtime_error("cannot register the objects on the bus");
    }
    if (notifications_) {
        notifications_->setPostObserver([this](const std::string& name, std::uint64_t state) {
            post([this, name, state] { emitPosted(name, state); });
        });
    }
    int r = sd_bus_add_match(
        bus_.bus, &nameOwnerChangedSlot_,
        "type='signal',sender='org.freedesktop.DBus',interface='org.freedesktop.DBus',"
        "member='NameOwnerChanged',path='/org/freedesktop/DBus'",
        &QVReportingDBusServer::onNameOwnerChanged, this);
    if (r >= 0) {
        r = sd_bus_request_name(bus_.bus, dbus::kBusName, 0);
    }
    if (r < 0) {
        throw std::runtime_error(fmt::format("cannot own {}: {}", dbus::kBusName, strerror(-r)));
    }
    const char* unique = nullptr;
    sd_bus_get_unique_name(bus_.bus, &unique);
    QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "owning bus name {} as {}", dbus::kBusName,
                  unique ? unique : "?");
    if (direct_) {
        QVLOG_DEFAULT(QVReportingServiceDelegateCategory(),
                      "listening for direct connections on {}", direct_->path());
    }
    loopThread_ = std::thread([this] {
        loop();
        drainPosted(true);
        closeConnections();
    });
}

bool QVReportingDBusServer::registerObjects(Connection& c) {
    auto add = [&c](const char* path, const char* interface, const sd_bus_vtable* vtable) {
        sd_bus_slot* slot = nullptr;
        if (sd_bus_add_object_vtable(c.bus, &slot, path, interface, vtable, &c) < 0) {
            return false;
        }
        c.slots.push_back(slot);
        return true;
    };
    return add(dbus::kObjectPath, dbus::kInterface, kReportingVtable) &&
           add(dbus::kObjectPath, dbus::kStatsInterface, kStatsVtable) &&
           (!notifications_ ||
            add(dbus::kNotifyObjectPath, dbus::kNotifyInterface, kNotifyVtable)) &&
           (!c.direct || add("/org/freedesktop/DBus", "org.freedesktop.DBus", kPeerBusVtable));
}

void QVReportingDBusServer::closeConnections() {
    unregisterObjects(bus_);
    // Each slot holds a reference on its bus.
    nameOwnerChangedSlot_ = sd_bus_slot_unref(nameOwnerChangedSlot_);
    // The daemon leaves, not its clients: as on the bus, they are not invalidated.
    while (!directConnections_.empty()) {
        closeDirectConnection(directConnections_.begin(), false);
    }
    direct_.reset();
    pending_.clear();
}

void QVReportingDBusServer::unregisterObjects(Connection& c) {
    for (sd_bus_slot* slot : c.slots) {
        sd_bus_slot_unref(slot);
    }
    c.slots.clear();
}

void QVReportingDBusServer::emitPosted(const std::string& name, std::uint64_t state) {
    auto emit = [&](sd_bus* bus) {
        sd_bus_emit_signal(bus, dbus::kNotifyObjectPath, dbus::kNotifyInterface, dbus::kPosted,
                           "st", name.c_str(), state);
    };
    if (!bus_.slots.empty()) {
        emit(bus_.bus);
    }
    for (Connection& c : directConnections_) {
        emit(c.bus);
    }
}

bool QVReportingDBusServer::post(std::function<void()> fn) {
    bool wake = false;
    {
        // A loop that ended (the bus was lost) runs nothing more.
        std::lock_guard lock(postMutex_);
        if (loopEnded_) {
            return false;
        }
        // One wake-up per batch: the loop takes everything posted when it drains.
        wake = posted_.empty();
        posted_.push_back(std::move(fn));
        postedWaiting_.store(true, std::memory_order_release);
    }
    if (wake) {
        const std::uint64_t one = 1;
        [[maybe_unused]] const auto n = ::write(wakeFd_, &one, sizeof one);
    }
    return true;
}

void QVReportingDBusServer::flush() {
    if (!loopThread_.joinable() || loopThread_.get_id() == std::this_thread::get_id()) {
        return;
    }
    std::promise<void> done;
    auto future = done.get_future();
    if (post([&done] { done.set_value(); })) {
        future.wait();
    }
}

void QVReportingDBusServer::drainPosted(bool last) {
    std::uint64_t count = 0;
    [[maybe_unused]] const auto n = ::read(wakeFd_, &count, sizeof count);
    std::deque<std::function<void()>> batch;
    {
        std::lock_guard lock(postMutex_);
        batch.swap(posted_);
        postedWaiting_.store(false, std::memory_order_relaxed);
        loopEnded_ = loopEnded_ || last;
    }
    for (auto& fn : batch) {
        try {
            fn();
        } catch (const std::exception& e) {
            QVLOG_ERROR(QVReportingServiceDelegateCategory(), "posted work failed: {}", e.what());
        }
    }
}

void QVReportingDBusServer::loop() {
    pthread_setname_np(pthread_self(), "qvreportd-bus");
    while (!stopping_) {
        if (callBytes_ >= limits_.maxCallBytes) {
            // Past the budget of all clients: leave what the connections send where it is until
            // the work taken in drains; answers reach this thread through post().
            if (!readsPaused_) {
                readsPaused_ = true;
                QVReportingStats::shared().noteBusReadsPaused();
                QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                            "calls not yet answered take {} bytes (at most {}): reading the "
                            "bus again when they drain",
                            callBytes_, limits_.maxCallBytes);
            }
            pollfd wake{wakeFd_, POLLIN, 0};
            if (::poll(&wake, 1, -1) < 0 && errno != EINTR) {
                QVLOG_ERROR(QVReportingServiceDelegateCategory(), "poll failed: {}", errno);
            }
            drainPosted();
            continue;
        }
        if (readsPaused_) {
            readsPaused_ = false;
            QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "reading the bus again");
        }
        const bool busy = processConnections();
        if (stopping_ || busy) {
            continue;
        }
        waitForWork();
    }
}

bool QVReportingDBusServer::processConnections() {
    bool busy = false;
    // Reads one connection for a turn; false once it has closed.
    auto turn = [&](Connection& c) {
        // The turn's calls cost the server queue two wake-ups at most (see WakeBatch).
        SerialQueue::WakeBatch batch(service_.queue());
        for (int i = 0; i < kCallsPerTurn && callBytes_ < limits_.maxCallBytes && !stopping_; ++i) {
            const int r = sd_bus_process(c.bus, nullptr);
            if (r < 0 || (c.direct && sd_bus_is_open(c.bus) <= 0)) {
                if (!c.direct) {
                    // Without a bus there is nothing to serve: stop the daemon the normal way.
                    QVLOG_ERROR(QVReportingServiceDelegateCategory(), "lost the bus: {}",
                                strerror(-r));
                    stopping_ = true;
                    ::kill(::getpid(), SIGTERM);
                }
                return false;
            }
            if (r == 0) {
                break;
            }
            busy = true;
            // Answers go out between calls: under a steady stream of calls the loop would
            // otherwise not reach its poll, and every answer would wait for a lull.
            if (postedWaiting_.load(std::memory_order_acquire)) {
                drainPosted();
            }
        }
        return true;
    };
    turn(bus_);
    for (auto it = directConnections_.begin(); it != directConnections_.end() && !stopping_;) {
        auto next = std::next(it);
        std::uint64_t unread = 0;
        if (!turn(*it)) {
            closeDirectConnection(it);
        } else if (sd_bus_get_n_queued_write(it->bus, &unread) >= 0 && unread > kMaxUnreadReplies) {
            QVReportingStats::shared().noteLimitExceeded(
                QVReportingStats::Limit::DirectRepliesUnread);
            QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                        "closing direct connection {} of pid {}: {} replies left unread", it->key,
                        it->pid, unread);
            closeDirectConnection(it);
        }
        it = next;
    }
    if (postedWaiting_.load(std::memory_order_acquire)) {
        drainPosted();
    }
    return busy;
}

void QVReportingDBusServer::waitForWork() {
    std::vector<pollfd> fds;
    fds.reserve(directConnections_.size() + 3);
    fds.push_back({wakeFd_, POLLIN, 0});
    if (direct_) {
        fds.push_back({direct_->fd(), POLLIN, 0});
    }
    std::uint64_t deadline = UINT64_MAX;
    auto watch = [&](const Connection& c) {
        std::uint64_t until = UINT64_MAX;
        const int events = sd_bus_get_events(c.bus);
        fds.push_back({sd_bus_get_fd(c.bus), static_cast<short>(events < 0 ? 0 : events), 0});
        if (sd_bus_get_timeout(c.bus, &until) > 0) {
            deadline = std::min(deadline, until);
        }
    };
    watch(bus_);
    for (const Connection& c : directConnections_) {
        watch(c);
    }
    int timeoutMs = -1;
    if (deadline != UINT64_MAX) {
        const std::uint64_t now = monotonicMicros();
        timeoutMs =
            deadline <= now
                ? 0
                : static_cast<int>(std::min<std::uint64_t>((deadline - now + 999) / 1000, 60000));
    }
    if (::poll(fds.data(), fds.size(), timeoutMs) < 0 && errno != EINTR) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "poll failed: {}", errno);
    }
    if (fds[0].revents & POLLIN) {
        drainPosted();
    }
    if (direct_ && (fds[1].revents & POLLIN)) {
        acceptDirectConnections();
    }
}

void QVReportingDBusServer::acceptDirectConnections() {
    while (auto peer = direct_->accept()) {
        // Every connection holds a descriptor and a little memory before it makes a call: they
        // are bounded like the clients.
        if (directConnections_.size() >= limits_.maxClients) {
            QVReportingStats::shared().noteLimitExceeded(QVReportingStats::Limit::Clients);
            QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                        "refusing a direct connection of pid {}: {} are open", peer->pid,
                        directConnections_.size());
            ::close(peer->fd);
            continue;
        }
        sd_bus* bus = nullptr;
        int r = sd_bus_new(&bus);
        if (r >= 0 && (r = sd_bus_set_fd(bus, peer->fd, peer->fd)) < 0) {
            bus = sd_bus_unref(bus);
        }
        if (r < 0) {
            QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                        "cannot serve a direct connection of pid {}: {}", peer->pid, strerror(-r));
            ::close(peer->fd);
            continue;
        }
        // The server end: the peer authenticates as itself (EXTERNAL) or as nobody (ANONYMOUS);
        // either way its credentials are the socket's. Payloads cannot hold unix fds, so none
        // are taken.
        if (r >= 0) {
            r = sd_bus_set_server(bus, 1, serverID_);
        }
        if (r >= 0) {
            r = sd_bus_set_anonymous(bus, 1);
        }
        if (r >= 0) {
            r = sd_bus_negotiate_fds(bus, 0);
        }
        if (r >= 0) {
            r = sd_bus_start(bus);
        }
        auto& c = directConnections_.emplace_back();
        c.server = this;
        c.bus = bus;
        c.direct = true;
        c.key = fmt::format("direct:{}", nextDirectID_++);
        c.pid = peer->pid;
        c.uid = peer->uid;
        if (r < 0 || !registerObjects(c)) {
            QVLOG_ERROR(QVReportingServiceDelegateCategory(),
                        "cannot serve a direct connection of pid {}: {}", peer->pid,
                        strerror(r < 0 ? -r : ENOMEM));
            closeDirectConnection(std::prev(directConnections_.end()));
            continue;
        }
        QVReportingStats::shared().noteDirectConnection();
        directCount_ = directConnections_.size();
        QVLOG_INFO(QVReportingServiceDelegateCategory(), "direct connection {} from pid {} uid {}",
                   c.key, c.pid, c.uid);
    }
}

void QVReportingDBusServer::closeDirectConnection(std::list<Connection>::iterator it,
                                                  bool clientLeft) {
    const std::string key = it->key;
    unregisterObjects(*it);
    if (it->bus) {
        sd_bus_close_unref(it->bus);
    }
    directConnections_.erase(it);
    directCount_ = directConnections_.size();
    if (clientLeft) {
        clientGone(key);
    }
}

int QVReportingDBusServer::onNameOwnerChanged(sd_bus_message* signal, void* userdata,
                                              sd_bus_error*) {
    auto* self = static_cast<QVReportingDBusServer*>(userdata);
    const char *name = nullptr, *oldOwner = nullptr, *newOwner = nullptr;
    if (sd_bus_message_read(signal, "sss", &name, &oldOwner, &newOwner) < 0 || *newOwner) {
        return 0;
    }
    try {
        self->clientGone(name);
    } catch (const std::exception& e) {
        QVLOG_ERROR(QVReportingServiceDelegateCategory(), "dropping client {} failed: {}", name,
                    e.what());
    }
    return 0;
}

void QVReportingDBusServer::clientGone(const std::string& key) {
    // Calls still kept for the departed client can never be answered.
    std::erase_if(pending_, [&](const auto& entry) {
        if (entry.second.client != key) {
            return false;
        }
        callBytes_ -= entry.second.bytes;
        heldCalls_ -= entry.second.held ? 1 : 0;
        return true;
    });
    noteBudgets();
    auto it = clients_.find(key);
    if (it == clients_.end()) {
        return;
    }
    auto client = std::move(it->second.instance);
    busClientCount_ -= it->second.direct ? 0 : 1;
    clients_.erase(it);
    QVLOG_DEFAULT(QVReportingServiceDelegateCategory(), "interruptionHandler: connection exited");
    service_.connectionInvalidated(client);
}

}  // namespace qv

#include "service/QVReportingDBusMessageBytes.h"

#include <errno.h>
#include <poll.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <string>
#include <string_view>

#include <systemd/sd-bus.h>
#include <systemd/sd-id128.h>

namespace qv {

namespace {

// Everything happens within this process over a local socket: these only bound a failure.
constexpr std::uint64_t kConnectMicros = 5'000'000;
constexpr std::uint64_t kTransferMicros = 30'000'000;
constexpr std::size_t kHeaderBytes = 16;

std::uint64_t nowMicros() {
    timespec ts{};
    clock_gettime(CLOCK_MONOTONIC, &ts);
    return static_cast<std::uint64_t>(ts.tv_sec) * 1000000u +
           static_cast<std::uint64_t>(ts.tv_nsec) / 1000u;
}

std::uint32_t u32At(const std::vector<std::uint8_t>& b, std::size_t at) {
    const bool big = b[0] == 'B';
    std::uint32_t v = 0;
    for (std::size_t i = 0; i < 4; ++i) {
        v = (v << 8) | b[at + (big ? i : 3 - i)];
    }
    return v;
}

}  // namespace

QVReportingDBusMessageBytes::~QVReportingDBusMessageBytes() {
    disconnect();
}

QVReportingDBusMessageBytes& QVReportingDBusMessageBytes::forThisThread() {
    thread_local QVReportingDBusMessageBytes instance;
    return instance;
}

void QVReportingDBusMessageBytes::disconnect() {
    // Nothing queued is wanted any more: no flush, which could wait on a peer that reads no more.
    if (bus_) {
        sd_bus_close_unref(bus_);  // closes its end of the socketpair
        bus_ = nullptr;
    }
    if (peer_ >= 0) {
        ::close(peer_);
        peer_ = -1;
    }
}

bool QVReportingDBusMessageBytes::connect() {
    int fds[2];
    if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0, fds) < 0) {
        return false;
    }
    peer_ = fds[1];
    sd_id128_t id{};
    if (sd_bus_new(&bus_) < 0) {
        ::close(fds[0]);
        disconnect();
        return false;
    }
    // The server end: it authenticates the peer as anonymous and sends only what it is given.
    if (sd_bus_set_fd(bus_, fds[0], fds[0]) < 0) {
        ::close(fds[0]);
        disconnect();
        return false;
    }
    // ANONYMOUS with its trace ("qv" in hex) given at once, so that the answer is OK, not DATA.
    static constexpr std::string_view kAuth("\0AUTH ANONYMOUS 7176\r\nBEGIN\r\n", 29);
    if (sd_id128_randomize(&id) < 0 || sd_bus_set_server(bus_, 1, id) < 0 ||
        sd_bus_set_anonymous(bus_, 1) < 0 || sd_bus_start(bus_) < 0 ||
        ::write(peer_, kAuth.data(), kAuth.size()) != static_cast<ssize_t>(kAuth.size())) {
        disconnect();
        return false;
    }
    // The bus answers "OK <guid>\r\n", then takes BEGIN and is ready.
    const std::uint64_t deadline = nowMicros() + kConnectMicros;
    std::string answer;
    while (sd_bus_is_ready(bus_) <= 0 || answer.find("\r\n") == std::string::npos) {
        if (sd_bus_process(bus_, nullptr) < 0 || nowMicros() > deadline) {
            disconnect();
            return false;
        }
        char buf[128];
        const ssize_t n = ::recv(peer_, buf, sizeof buf, 0);
        if (n > 0) {
            answer.append(buf, static_cast<std::size_t>(n));
        } else if (n == 0 || (errno != EAGAIN && errno != EINTR)) {
            disconnect();
            return false;
        } else if (sd_bus_is_ready(bus_) <= 0) {
            sd_bus_wait(bus_, 10'000);
        }
    }
    if (!answer.starts_with("OK ")) {
        disconnect();
        return false;
    }
    return true;
}

bool QVReportingDBusMessageBytes::pump(std::vector<std::uint8_t>& into, std::size_t want,
                                       std::uint64_t deadlineMicros) {
    while (into.size() < want) {
        std::uint64_t queued = 0;
        if (sd_bus_get_n_queued_write(bus_, &queued) < 0 ||
            (queued > 0 && sd_bus_process(bus_, nullptr) < 0)) {
            return false;
        }
        const std::size_t at = into.size();
        into.resize(want);
        const ssize_t n = ::recv(peer_, into.data() + at, want - at, 0);
        into.resize(at + (n > 0 ? static_cast<std::size_t>(n) : 0));
        if (n == 0 || (n < 0 && errno != EAGAIN && errno != EINTR)) {
            return false;
        }
        if (n < 0) {
            if (nowMicros() > deadlineMicros) {
                return false;
            }
            pollfd p{peer_, POLLIN, 0};
            ::poll(&p, 1, queued > 0 ? 1 : 100);
        }
    }
    return true;
}

std::optional<std::vector<std::uint8_t>> QVReportingDBusMessageBytes::of(sd_bus_message* message) {
    if (!bus_ && !connect()) {
        return std::nullopt;
    }
    const int sent = sd_bus_send(bus_, message, nullptr);
    if (sent < 0) {
        // Refused before anything was written (unix fds, a message not sealed): the connection
        // is as good as before.
        if (sent != -EOPNOTSUPP && sent != -EPERM) {
            disconnect();
        }
        return std::nullopt;
    }
    const std::uint64_t deadline = nowMicros() + kTransferMicros;
    std::vector<std::uint8_t> bytes;
    if (!pump(bytes, kHeaderBytes, deadline)) {
        disconnect();
        return std::nullopt;
    }
    // The header fields (their length at byte 12) end padded to 8; the body (its length at byte
    // 4) follows.
    const std::uint64_t fields = (kHeaderBytes + std::uint64_t{u32At(bytes, 12)} + 7) / 8 * 8;
    const std::uint64_t total = fields + u32At(bytes, 4);
    if (!pump(bytes, static_cast<std::size_t>(total), deadline)) {
        disconnect();
        return std::nullopt;
    }
    return bytes;
}

}  // namespace qv

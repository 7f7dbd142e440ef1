#include "platform/linux/capture/LinuxProcessLauncher.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <thread>

extern char** environ;

namespace qv {

namespace {

using SteadyClock = std::chrono::steady_clock;

// Time a process that closed its output is given to exit after the time-out has passed.
constexpr std::chrono::milliseconds kExitGrace{100};

class LinuxProcessPipe final : public ProcessPipe {
  public:
    LinuxProcessPipe(int fd, pid_t pid, const ProcessPipeLimits& limits)
        : fd_(fd),
          pid_(pid),
          deadline_(SteadyClock::now() + limits.timeout),
          maxBytes_(limits.maxOutputBytes) {}

    ~LinuxProcessPipe() override {
        if (!closed_) {
            close();
        }
    }

    std::optional<std::string> readLine() override {
        while (true) {
            const std::size_t eol = buffer_.find('\n', start_);
            if (eol != std::string::npos) {
                std::string line = buffer_.substr(start_, eol + 1 - start_);
                start_ = eol + 1;
                return line;
            }
            if (ended_) {
                if (start_ < buffer_.size()) {
                    std::string line = buffer_.substr(start_);
                    start_ = buffer_.size();
                    return line;
                }
                return std::nullopt;
            }
            fill();
        }
    }

    Outcome close() override {
        closed_ = true;
        if (fd_ >= 0) {
            ::close(fd_);
            fd_ = -1;
        }
        if (!timedOut_ && !truncated_) {
            // Output ended on its own: the process is on its way out; give it until the
            // time-out (and a little) before it counts as hanging.
            const auto limit = std::max(deadline_, SteadyClock::now()) + kExitGrace;
            auto pause = std::chrono::microseconds(200);
            while (SteadyClock::now() < limit) {
                if (reap(WNOHANG)) {
                    return outcome();
                }
                std::this_thread::sleep_for(pause);
                pause = std::min(pause * 2, std::chrono::microseconds(10000));
            }
            timedOut_ = true;
        }
        ::kill(-pid_, SIGKILL);
        reap(0);
        return outcome();
    }

  private:
    // Reads what the process prints next, or ends the output.
    void fill() {
        if (bytesRead_ >= maxBytes_) {
            truncated_ = true;
            ended_ = true;
            return;
        }
        const auto left =
            std::chrono::duration_cast<std::chrono::milliseconds>(deadline_ - SteadyClock::now());
        if (left.count() <= 0) {
            timedOut_ = true;
            ended_ = true;
            return;
        }
        pollfd p{fd_, POLLIN, 0};
        const int ready =
            ::poll(&p, 1, static_cast<int>(std::min<long long>(left.count() + 1, 1 << 30)));
        if (ready < 0) {
            if (errno != EINTR) {
                ended_ = true;
            }
            return;
        }
        if (ready == 0) {
            return;  // the deadline is checked on the next pass
        }
        if (start_ > 0 && start_ == buffer_.size()) {
            buffer_.clear();
            start_ = 0;
        }
        char chunk[4096];
        const std::size_t want = std::min(sizeof chunk, maxBytes_ - bytesRead_);
        const ssize_t n = ::read(fd_, chunk, want);
        if (n < 0) {
            if (errno != EINTR && errno != EAGAIN) {
                ended_ = true;
            }
            return;
        }
        if (n == 0) {
            ended_ = true;
            return;
        }
        bytesRead_ += static_cast<std::size_t>(n);
        buffer_.append(chunk, static_cast<std::size_t>(n));
    }

    bool reap(int options) {
        int status = 0;
        pid_t r;
        do {
            r = ::waitpid(pid_, &status, options);
        } while (r < 0 && errno == EINTR);
        if (r == 0) {
            return false;
        }
        status_ = r < 0 ? 0 : status;
        return true;
    }

    Outcome outcome() const {
        Outcome o;
        if (truncated_) {
            o.ending = Ending::Truncated;
        } else if (timedOut_) {
            o.ending = Ending::TimedOut;
        } else if (WIFSIGNALED(status_)) {
            o.ending = Ending::Signalled;
            o.exitStatus = WTERMSIG(status_);
        } else {
            o.exitStatus = WEXITSTATUS(status_);
            // The shell's own codes for "not found" and "cannot execute".
            o.ending = (o.exitStatus == 126 || o.exitStatus == 127) && bytesRead_ == 0
                           ? Ending::NotExecutable
                           : Ending::Exited;
        }
        return o;
    }

    int fd_;
    const pid_t pid_;
    const SteadyClock::time_point deadline_;
    const std::size_t maxBytes_;
    std::string buffer_;
    std::size_t start_ = 0;
    std::size_t bytesRead_ = 0;
    bool ended_ = false;
    bool timedOut_ = false;
    bool truncated_ = false;
    bool closed_ = false;
    int status_ = 0;
};

}  // namespace

ProcessLauncher::Launched LinuxProcessLauncher::launch(const std::string& command,
                                                       const ProcessPipeLimits& limits) {
    int fds[2];
    if (::pipe2(fds, O_CLOEXEC) != 0) {
        return {nullptr, errno};
    }
    posix_spawn_file_actions_t actions;
    posix_spawnattr_t attr;
    posix_spawn_file_actions_init(&actions);
    posix_spawnattr_init(&attr);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, fds[1], 1);
    posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
    // Only ignored signals survive exec; these are the ones a daemon may have ignored.
    sigset_t none, defaults;
    sigemptyset(&none);
    sigemptyset(&defaults);
    for (const int sig : {SIGPIPE, SIGTERM, SIGINT, SIGHUP, SIGQUIT, SIGCHLD, SIGUSR1, SIGUSR2}) {
        sigaddset(&defaults, sig);
    }
    posix_spawnattr_setsigmask(&attr, &none);
    posix_spawnattr_setsigdefault(&attr, &defaults);
    posix_spawnattr_setpgroup(&attr, 0);
    posix_spawnattr_setflags(
        &attr, POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
    std::string shell = "sh", dashC = "-c", script = command;
    char* argv[] = {shell.data(), dashC.data(), script.data(), nullptr};
    pid_t pid = 0;
    const int error = ::posix_spawn(&pid, "/bin/sh", &actions, &attr, argv, environ);
    posix_spawn_file_actions_destroy(&actions);
    posix_spawnattr_destroy(&attr);
    ::close(fds[1]);
    if (error != 0) {
        ::close(fds[0]);
        return {nullptr, error};
    }
    return {std::make_unique<LinuxProcessPipe>(fds[0], pid, limits), 0};
}

}  // namespace qv

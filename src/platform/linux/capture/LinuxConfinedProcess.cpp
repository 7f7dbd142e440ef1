#include "platform/linux/capture/LinuxConfinedProcess.h"
#include "platform/linux/system/ErrnoText.h"

#include <fcntl.h>
#include <linux/landlock.h>
#include <poll.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <system_error>

#include <fmt/format.h>

namespace qv {

namespace {

#ifndef LANDLOCK_ACCESS_FS_REFER
#define LANDLOCK_ACCESS_FS_REFER (1ULL << 13)
#endif
#ifndef LANDLOCK_ACCESS_FS_TRUNCATE
#define LANDLOCK_ACCESS_FS_TRUNCATE (1ULL << 14)
#endif

class Fd {
  public:
    explicit Fd(int fd = -1) : fd_(fd) {}
    ~Fd() { reset(); }
    Fd(const Fd&) = delete;
    Fd& operator=(const Fd&) = delete;
    int get() const { return fd_; }
    int release() {
        const int fd = fd_;
        fd_ = -1;
        return fd;
    }
    void reset(int fd = -1) {
        if (fd_ >= 0) {
            ::close(fd_);
        }
        fd_ = fd;
    }

  private:
    int fd_;
};

int landlockAbi() {
    const long abi =
        ::syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
    return abi < 0 ? -static_cast<int>(errno) : static_cast<int>(abi);
}

// A Landlock ruleset that allows writes under directory and to /dev/null only; -1 with a reason
// when it cannot be made. REQUIRES: abi >= 1.
int makeWriteRuleset(int abi, const std::filesystem::path& directory, std::string& reason) {
    std::uint64_t fileWrites = LANDLOCK_ACCESS_FS_WRITE_FILE;
    if (abi >= 3) {
        fileWrites |= LANDLOCK_ACCESS_FS_TRUNCATE;
    }
    std::uint64_t writes = fileWrites | LANDLOCK_ACCESS_FS_REMOVE_DIR |
                           LANDLOCK_ACCESS_FS_REMOVE_FILE | LANDLOCK_ACCESS_FS_MAKE_CHAR |
                           LANDLOCK_ACCESS_FS_MAKE_DIR | LANDLOCK_ACCESS_FS_MAKE_REG |
                           LANDLOCK_ACCESS_FS_MAKE_SOCK | LANDLOCK_ACCESS_FS_MAKE_FIFO |
                           LANDLOCK_ACCESS_FS_MAKE_BLOCK | LANDLOCK_ACCESS_FS_MAKE_SYM;
    if (abi >= 2) {
        writes |= LANDLOCK_ACCESS_FS_REFER;
    }
    landlock_ruleset_attr attr{};
    attr.handled_access_fs = writes;
    Fd ruleset(static_cast<int>(::syscall(SYS_landlock_create_ruleset, &attr, sizeof attr, 0)));
    if (ruleset.get() < 0) {
        reason = "cannot make a Landlock ruleset: " + errnoText(errno);
        return -1;
    }
    auto allow = [&](const char* path, std::uint64_t access) {
        Fd target(::open(path, O_PATH | O_CLOEXEC));
        if (target.get() < 0) {
            reason = fmt::format("cannot open {}: {}", path, errnoText(errno));
            return false;
        }
        landlock_path_beneath_attr rule{};
        rule.allowed_access = access;
        rule.parent_fd = target.get();
        if (::syscall(SYS_landlock_add_rule, ruleset.get(), LANDLOCK_RULE_PATH_BENEATH, &rule, 0) <
            0) {
            reason = fmt::format("cannot add a Landlock rule for {}: {}", path, errnoText(errno));
            return false;
        }
        return true;
    };
    if (!allow(directory.c_str(), writes) || !allow("/dev/null", fileWrites)) {
        return -1;
    }
    return ruleset.release();
}

// Everything the child needs, made before fork: after fork only async-signal-safe calls run.
struct ChildPlan {
    std::vector<std::string> strings;
    std::vector<char*> argv;
    std::vector<char*> envp;
};

[[noreturn]] void childFails(int reportFd) {
    const int error = errno;
    [[maybe_unused]] const ssize_t n = ::write(reportFd, &error, sizeof error);
    ::_exit(127);
}

// In the child, between fork and exec.
[[noreturn]] void runChild(const ConfinedCommand& command, const ChildPlan& plan, pid_t parent,
                           int devNull, int reportFd, int rulesetFd) {
    sigset_t none;
    sigemptyset(&none);
    ::sigprocmask(SIG_SETMASK, &none, nullptr);
    ::signal(SIGPIPE, SIG_DFL);
    // Writes beyond the file bound fail with EFBIG instead of killing the child.
    ::signal(SIGXFSZ, SIG_IGN);
    ::setpgid(0, 0);
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (::getppid() != parent) {
        ::_exit(127);
    }
    const int out = command.standardOutput >= 0 ? command.standardOutput : devNull;
    const int err = command.standardError >= 0 ? command.standardError : devNull;
    if (::dup2(devNull, 0) < 0 || ::dup2(out, 1) < 0 || ::dup2(err, 2) < 0) {
        childFails(reportFd);
    }
    if (rulesetFd >= 0) {
        if (::prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) < 0 ||
            ::syscall(SYS_landlock_restrict_self, rulesetFd, 0) < 0) {
            childFails(reportFd);
        }
    }
    // The report pipe moves to 3 (closed by exec) so that everything above it can go.
    if (reportFd != 3) {
        if (::dup2(reportFd, 3) < 0) {
            childFails(reportFd);
        }
        reportFd = 3;
    }
    ::fcntl(3, F_SETFD, FD_CLOEXEC);
    if (::syscall(SYS_close_range, 4u, ~0u, 0u) < 0) {
        for (int fd = 4; fd < 65536; ++fd) {
            ::close(fd);
        }
    }
    const rlimit size{command.maxFileBytes, command.maxFileBytes};
    if (command.maxFileBytes > 0 && ::setrlimit(RLIMIT_FSIZE, &size) < 0) {
        childFails(reportFd);
    }
    if (command.niceness != 0) {
        [[maybe_unused]] const int niceness = ::nice(command.niceness);
    }
    if (::chdir(command.directory.c_str()) < 0) {
        childFails(reportFd);
    }
    ::execve(command.program.c_str(), plan.argv.data(), plan.envp.data());
    childFails(reportFd);
}

ChildPlan makePlan(const ConfinedCommand& command) {
    ChildPlan plan;
    plan.strings.reserve(command.arguments.size() + command.environment.size() + 1);
    plan.strings.push_back(std::filesystem::path(command.program).filename().string());
    for (const auto& a : command.arguments) {
        plan.strings.push_back(a);
    }
    const std::size_t argc = plan.strings.size();
    for (const auto& e : command.environment) {
        plan.strings.push_back(e);
    }
    for (std::size_t i = 0; i < argc; ++i) {
        plan.argv.push_back(plan.strings[i].data());
    }
    plan.argv.push_back(nullptr);
    for (std::size_t i = argc; i < plan.strings.size(); ++i) {
        plan.envp.push_back(plan.strings[i].data());
    }
    plan.envp.push_back(nullptr);
    return plan;
}

// Waits until the child has ended (left as a zombie, not reaped), the deadline passes or cancelFd
// becomes readable. Returns 0 for ended, 1 for the deadline, 2 for cancelled.
int waitForEnd(pid_t pid, int pidFd, int cancelFd, std::chrono::steady_clock::time_point deadline) {
    for (;;) {
        const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
            deadline - std::chrono::steady_clock::now());
        if (left.count() <= 0) {
            siginfo_t info{};
            if (::waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
                info.si_pid == pid) {
                return 0;
            }
            return 1;
        }
        pollfd fds[2] = {{pidFd, POLLIN, 0}, {cancelFd, POLLIN, 0}};
        const int count = cancelFd >= 0 ? 2 : 1;
        // Without a process descriptor (an old kernel), look every 20 ms instead.
        const int wait = pidFd >= 0 ? static_cast<int>(std::min<long long>(left.count(), 1 << 30))
                                    : static_cast<int>(std::min<long long>(left.count(), 20));
        if (pidFd < 0) {
            fds[0].fd = -1;
        }
        const int r = ::poll(fds, count, wait);
        if (r < 0 && errno != EINTR) {
            return 1;
        }
        if (cancelFd >= 0 && (fds[1].revents & (POLLIN | POLLHUP | POLLERR)) != 0) {
            return 2;
        }
        if (pidFd >= 0 && (fds[0].revents & POLLIN) != 0) {
            return 0;
        }
        if (pidFd < 0) {
            siginfo_t info{};
            if (::waitid(P_PID, static_cast<id_t>(pid), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
                info.si_pid == pid) {
                return 0;
            }
        }
    }
}

}  // namespace

std::optional<std::string> QVReportingConfinementUnavailableReason() {
    const int abi = landlockAbi();
    if (abi < 1) {
        return "Landlock is not available: " + errnoText(-abi);
    }
    return std::nullopt;
}

ConfinedResult runConfined(const ConfinedCommand& command, int cancelFd) {
    ConfinedResult result;
    Fd devNull(::open("/dev/null", O_RDWR | O_CLOEXEC));
    if (devNull.get() < 0) {
        result.error = "cannot open /dev/null: " + errnoText(errno);
        return result;
    }
    // Where the kernel can confine, a child that cannot be confined is not started; where it
    // cannot, the child runs with the other bounds only, and the caller is told.
    Fd ruleset;
    if (const int abi = landlockAbi(); abi >= 1) {
        std::string reason;
        ruleset.reset(makeWriteRuleset(abi, command.directory, reason));
        if (ruleset.get() < 0) {
            result.error = "cannot confine " + command.program + ": " + reason;
            return result;
        }
        result.confined = true;
    }
    int pipeFds[2];
    if (::pipe2(pipeFds, O_CLOEXEC) < 0) {
        result.error = "cannot make a pipe: " + errnoText(errno);
        return result;
    }
    Fd reportRead(pipeFds[0]);
    Fd reportWrite(pipeFds[1]);
    const ChildPlan plan = makePlan(command);
    const pid_t parent = ::getpid();

    const pid_t pid = ::fork();
    if (pid < 0) {
        result.error = "cannot fork: " + errnoText(errno);
        return result;
    }
    if (pid == 0) {
        runChild(command, plan, parent, devNull.get(), reportWrite.get(), ruleset.get());
    }
    // Also done in the child; done here too so that a signal sent at once finds the group.
    ::setpgid(pid, pid);
    reportWrite.reset();
    const auto start = std::chrono::steady_clock::now();

    int childError = 0;
    ssize_t n;
    do {
        n = ::read(reportRead.get(), &childError, sizeof childError);
    } while (n < 0 && errno == EINTR);
    const bool started = n == 0;

    Fd pidFd(static_cast<int>(::syscall(SYS_pidfd_open, pid, 0)));
    int ended = 0;
    if (started) {
        ended = waitForEnd(pid, pidFd.get(), cancelFd, start + command.timeout);
        if (ended == 1) {
            ::kill(-pid, SIGINT);
            if (waitForEnd(pid, pidFd.get(), cancelFd,
                           std::chrono::steady_clock::now() + command.killGrace) != 0) {
                ::kill(-pid, SIGKILL);
            }
        } else if (ended == 2) {
            ::kill(-pid, SIGKILL);
        }
    }
    // The leader is not reaped yet, so the group's number cannot have been reused: whatever the
    // child left behind in its group goes with it.
    ::kill(-pid, SIGKILL);
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    if (!started) {
        result.outcome = ConfinedResult::Outcome::StartFailed;
        result.error = fmt::format("cannot start {}: {}", command.program, errnoText(childError));
    } else if (ended == 1) {
        result.outcome = ConfinedResult::Outcome::TimedOut;
    } else if (ended == 2) {
        result.outcome = ConfinedResult::Outcome::Cancelled;
    } else if (WIFEXITED(status)) {
        result.outcome = ConfinedResult::Outcome::Exited;
        result.status = WEXITSTATUS(status);
    } else {
        result.outcome = ConfinedResult::Outcome::Signaled;
        result.status = WIFSIGNALED(status) ? WTERMSIG(status) : 0;
    }
    return result;
}

}  // namespace qv

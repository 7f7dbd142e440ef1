// Runs a helper program (a profiler, say) as a confined child of the daemon:
// - it inherits no descriptor but standard input (/dev/null), output and error;
// - it may write only inside one directory (its working directory): Landlock rules forbid every
//   other write where the kernel offers them, and no file it writes may grow beyond a bound;
// - it runs in a process group of its own, dies with the thread that started it, and gets back
//   the default signal mask and dispositions the daemon changed for itself;
// - it is stopped at its deadline: SIGINT to the group first, so that it can write out what it
//   has, SIGKILL after a grace period; and at once with SIGKILL when the caller cancels.
//
// Thread safety: runConfined may be called from any thread; it blocks that thread until the child
// is gone.
#pragma once

#include <chrono>
#include <cstdint>
#include <filesystem>
#include <optional>
#include <string>
#include <vector>

namespace qv {

struct ConfinedCommand {
    // Absolute path of the program; argv[0] is its file name.
    std::string program;
    std::vector<std::string> arguments;
    // The whole environment, "NAME=value" each; nothing else is passed on.
    std::vector<std::string> environment;
    // The working directory and the only directory the child may write in.
    std::filesystem::path directory;
    // Descriptors that become standard output and error; -1 for /dev/null. The caller keeps them.
    int standardOutput = -1;
    int standardError = -1;
    // No file the child writes may grow beyond this many bytes (writes beyond fail).
    std::uint64_t maxFileBytes = 0;
    // Scheduling niceness added to the daemon's for the child.
    int niceness = 0;
    // From the start to SIGINT, and from SIGINT to SIGKILL.
    std::chrono::milliseconds timeout{0};
    std::chrono::milliseconds killGrace{2000};
};

struct ConfinedResult {
    enum class Outcome {
        Exited,       // status holds the exit status
        Signaled,     // status holds the signal
        TimedOut,     // stopped at its deadline
        Cancelled,    // stopped because the cancel descriptor became readable
        StartFailed,  // error says why
    };
    Outcome outcome = Outcome::StartFailed;
    int status = 0;
    std::string error;
    // Whether the write confinement was in force (false where the kernel has no Landlock).
    bool confined = false;
};

// Runs the command to its end. cancelFd, when not -1, is watched: once it is readable the child
// is killed and the result is Cancelled.
ConfinedResult runConfined(const ConfinedCommand& command, int cancelFd);

// Nothing when writes can be confined on this kernel, else why not.
std::optional<std::string> QVReportingConfinementUnavailableReason();

}  // namespace qv

// Process execution with a pipe: a command run through the shell, its standard output read line
// by line. Every run is bounded: after its time-out, or once it has printed its byte limit, the
// process (and every process it started) is killed and its output ends there.
//
// Thread safety: launch() may be called from any thread at once. A ProcessPipe belongs to the
// thread that reads it.
#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>

namespace qv {

struct ProcessPipeLimits {
    // From the launch to the end of output and the process's exit.
    std::chrono::milliseconds timeout{3000};
    // Bytes of output read at most.
    std::size_t maxOutputBytes = 1024 * 1024;
};

class ProcessPipe {
  public:
    enum class Ending {
        Exited,         // the command ran to its end (exitStatus says how)
        NotExecutable,  // the shell could not find or run the command: nothing was printed
        Signalled,      // killed by a signal nobody here sent
        TimedOut,       // killed at the time-out; output ends there
        Truncated,      // killed at the byte limit; output ends there
    };
    struct Outcome {
        Ending ending = Ending::Exited;
        int exitStatus = 0;  // the exit status, or the signal for Signalled
    };

    // Ends the process as close() does, if close() was not called.
    virtual ~ProcessPipe() = default;
    // The next line of output with its line feed (the last line may lack one); nothing once the
    // output has ended (end of file, time-out or byte limit).
    virtual std::optional<std::string> readLine() = 0;
    // Closes the pipe, ends the process (killing it if it outlives the time-out) and reaps it.
    // Call once.
    virtual Outcome close() = 0;
};

class ProcessLauncher {
  public:
    struct Launched {
        std::unique_ptr<ProcessPipe> pipe;  // null when the command could not be started
        int error = 0;                      // errno-style reason when pipe is null
    };

    virtual ~ProcessLauncher() = default;
    // Starts "/bin/sh -c command" with standard input and error on /dev/null and standard output
    // on the returned pipe.
    virtual Launched launch(const std::string& command, const ProcessPipeLimits& limits) = 0;
};

}  // namespace qv

#include "platform/linux/capture/LinuxProcessLauncher.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

namespace qv {
namespace {

using Ending = ProcessPipe::Ending;

struct Finished {
    std::vector<std::string> lines;
    ProcessPipe::Outcome outcome;
};

Finished run(const std::string& command, ProcessPipeLimits limits = {}) {
    LinuxProcessLauncher launcher;
    auto launched = launcher.launch(command, limits);
    EXPECT_TRUE(launched.pipe) << launched.error;
    Finished r;
    if (!launched.pipe) {
        return r;
    }
    while (auto line = launched.pipe->readLine()) {
        r.lines.push_back(*line);
    }
    r.outcome = launched.pipe->close();
    return r;
}

TEST(TheLinuxProcessLauncher, ReadsLinesAndTellsHowTheCommandEnded) {
    const Finished lines = run("printf 'one\\ntwo\\n\\nlast' | cat");
    EXPECT_EQ(lines.lines, (std::vector<std::string>{"one\n", "two\n", "\n", "last"}));
    EXPECT_EQ(lines.outcome.ending, Ending::Exited);
    EXPECT_EQ(lines.outcome.exitStatus, 0);

    const Finished failed = run("echo partial; echo not output >&2; exit 3");
    EXPECT_EQ(failed.lines, (std::vector<std::string>{"partial\n"}));
    EXPECT_EQ(failed.outcome.ending, Ending::Exited);
    EXPECT_EQ(failed.outcome.exitStatus, 3);

    // Standard error is not part of the output (above); a missing tool, told apart, is the
    // end-to-end MemoryLog test's.
    const Finished killed = run("echo before; kill -TERM $$");
    EXPECT_EQ(killed.outcome.ending, Ending::Signalled);
    EXPECT_EQ(killed.outcome.exitStatus, SIGTERM);

    // Signals the caller blocks or ignores are not inherited: the pipeline ends as usual.
    sigset_t block, old;
    sigemptyset(&block);
    sigaddset(&block, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &block, &old);
    const auto oldPipe = signal(SIGPIPE, SIG_IGN);
    const Finished pipeline = run("yes | head -n 2; kill -TERM $$; echo not reached");
    signal(SIGPIPE, oldPipe);
    pthread_sigmask(SIG_SETMASK, &old, nullptr);
    EXPECT_EQ(pipeline.lines, (std::vector<std::string>{"y\n", "y\n"}));
    EXPECT_EQ(pipeline.outcome.ending, Ending::Signalled);
}

TEST(TheLinuxProcessLauncher, KillsWhatOutlivesItsTimeOutOrPrintsBeyondItsLimit) {
    ProcessPipeLimits limits;
    // Long enough for the shell to print its first line on a busy machine; what follows sleeps
    // far longer.
    limits.timeout = std::chrono::seconds(2);

    // Hangs while printing nothing, the whole pipeline with it.
    const Finished hung = run("echo started; sleep 30 | cat", limits);
    EXPECT_EQ(hung.lines, (std::vector<std::string>{"started\n"}));
    EXPECT_EQ(hung.outcome.ending, Ending::TimedOut);

    // Closes its output but does not leave.
    const Finished lingering = run("echo bye; exec >&-; sleep 30", limits);
    EXPECT_EQ(lingering.lines, (std::vector<std::string>{"bye\n"}));
    EXPECT_EQ(lingering.outcome.ending, Ending::TimedOut);

    // Prints without end: cut at the byte limit, mid-line.
    limits.timeout = std::chrono::seconds(10);
    limits.maxOutputBytes = 10001;
    const Finished chatty = run("yes", limits);
    std::size_t bytes = 0;
    for (const auto& l : chatty.lines) {
        bytes += l.size();
    }
    EXPECT_EQ(bytes, 10001u);
    EXPECT_EQ(chatty.lines.back(), "y");
    EXPECT_EQ(chatty.outcome.ending, Ending::Truncated);
}

}  // namespace
}  // namespace qv

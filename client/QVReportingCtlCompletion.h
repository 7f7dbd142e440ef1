// Shell completion of qvreportctl, answered by qvreportctl itself: the completion function of
// bash run `qvreportctl __complete -- WORD...` (a command the help leaves out) and offer what it
// prints, so subcommands and options come from the very command-line definition that parses them.
#pragma once

#include <string>
#include <vector>

#include <CLI/CLI.hpp>

namespace qv::ctl {

// Prints the candidates for the last of words (the word under the cursor, perhaps empty), one a
// line: the subcommands and options that may come there, an option's values (--bus), the sinks
// of the state directory's sinks/, the suites of its defaults/. words are the command line after
// the program's name. Instead of candidates, "@files" or "@dirs" asks the shell for its own file
// or directory names. Returns the exit status (0).
int QVReportingCtlComplete(const CLI::App& app, const std::vector<std::string>& words);

}  // namespace qv::ctl

// Runs gnuplot (the svg terminal) as a child process over one script that draws several plots,
// and hands back each plot's SVG text.
//
// Thread safety: one QVReportingCtlGnuplot per thread.
#pragma once

#include <stdexcept>
#include <string>
#include <vector>

namespace qv::client {

// gnuplot could not be run: not installed, or it failed (its error output in the message).
class QVReportingCtlGnuplotError : public std::runtime_error {
  public:
    using std::runtime_error::runtime_error;
};

class QVReportingCtlGnuplot {
  public:
    // program: the gnuplot to run, found on PATH.
    explicit QVReportingCtlGnuplot(std::string program = "gnuplot")
        : program_(std::move(program)) {}

    // Adds a plot: commands that draw one graph (they must not set the terminal or the output);
    // returns its index in run()'s result.
    std::size_t add(std::string commands);

    // Draws every plot added, each as an SVG of width x height, in one run of gnuplot. Throws
    // QVReportingCtlGnuplotError.
    std::vector<std::string> run(int width, int height) const;

    // A gnuplot string literal of text: single-quoted, quotes doubled, control characters
    // replaced by blanks.
    static std::string quote(const std::string& text);

  private:
    std::string program_;
    std::vector<std::string> plots_;
};

}  // namespace qv::client

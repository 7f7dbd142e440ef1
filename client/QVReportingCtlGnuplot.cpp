#include "QVReportingCtlGnuplot.h"

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <sstream>

#include <fcntl.h>
#include <fmt/format.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

extern char** environ;

namespace qv::client {

namespace {

std::string readFile(const std::filesystem::path& path) {
    std::ifstream in(path, std::ios::binary);
    std::ostringstream out;
    out << in.rdbuf();
    return out.str();
}

// A directory of our own for the script, the plots and gnuplot's error output, removed after.
class TemporaryDirectory {
  public:
    TemporaryDirectory() {
        const char* base = std::getenv("TMPDIR");
        std::string pattern = std::string(base && *base ? base : "/tmp") + "/qvreportctl.XXXXXX";
        if (!::mkdtemp(pattern.data())) {
            throw QVReportingCtlGnuplotError(fmt::format("cannot make a temporary directory {}: {}",
                                                         pattern, std::strerror(errno)));
        }
        path_ = pattern;
    }
    ~TemporaryDirectory() {
        std::error_code ec;
        std::filesystem::remove_all(path_, ec);
    }
    TemporaryDirectory(const TemporaryDirectory&) = delete;
    TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

    const std::filesystem::path& path() const { return path_; }

  private:
    std::filesystem::path path_;
};

}  // namespace

std::size_t QVReportingCtlGnuplot::add(std::string commands) {
    plots_.push_back(std::move(commands));
    return plots_.size() - 1;
}

std::string QVReportingCtlGnuplot::quote(const std::string& text) {
    std::string out = "'";
    for (const char c : text) {
        if (c == '\'') {
            out += "''";
        } else if (static_cast<unsigned char>(c) < 0x20 || c == 0x7F) {
            out += ' ';
        } else {
            out += c;
        }
    }
    return out + "'";
}

std::vector<std::string> QVReportingCtlGnuplot::run(int width, int height) const {
    if (plots_.empty()) {
        return {};
    }
    const TemporaryDirectory dir;
    const auto plotPath = [&](std::size_t i) { return dir.path() / fmt::format("plot{}.svg", i); };
    {
        std::ofstream script(dir.path() / "plots.gp");
        // noenhanced: application names hold underscores, which would turn into subscripts.
        script << fmt::format(
            "set terminal svg size {},{} dynamic noenhanced font 'sans,11' background '#ffffff'\n",
            width, height);
        for (std::size_t i = 0; i < plots_.size(); ++i) {
            script << "reset\nset output " << quote(plotPath(i).string()) << '\n'
                   << plots_[i] << "\nunset output\n";
        }
        if (!script) {
            throw QVReportingCtlGnuplotError("cannot write the plot script in " +
                                             dir.path().string());
        }
    }
    const std::string scriptPath = (dir.path() / "plots.gp").string();
    const std::string errorPath = (dir.path() / "errors.txt").string();
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, errorPath.c_str(),
                                     O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
    posix_spawn_file_actions_adddup2(&actions, 1, 2);
    std::vector<char*> argv{const_cast<char*>(program_.c_str()),
                            const_cast<char*>(scriptPath.c_str()), nullptr};
    pid_t pid = 0;
    const int spawned =
        posix_spawnp(&pid, program_.c_str(), &actions, nullptr, argv.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    if (spawned == ENOENT) {
        throw QVReportingCtlGnuplotError(
            "gnuplot is not installed; the report draws its plots with it: install the Debian "
            "package gnuplot-nox (apt-get install gnuplot-nox)");
    }
    if (spawned != 0) {
        throw QVReportingCtlGnuplotError(
            fmt::format("cannot run {}: {}", program_, std::strerror(spawned)));
    }
    int status = 0;
    while (::waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
    const std::string errors = readFile(errorPath);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) {
        throw QVReportingCtlGnuplotError(
            fmt::format("{} failed ({}): {}", program_,
                        WIFEXITED(status) ? fmt::format("exit {}", WEXITSTATUS(status))
                                          : fmt::format("signal {}", WTERMSIG(status)),
                        errors));
    }
    std::vector<std::string> svgs;
    for (std::size_t i = 0; i < plots_.size(); ++i) {
        std::string svg = readFile(plotPath(i));
        if (svg.find("<svg") == std::string::npos) {
            throw QVReportingCtlGnuplotError(
                fmt::format("{} drew no plot {}: {}", program_, i, errors));
        }
        svgs.push_back(std::move(svg));
    }
    return svgs;
}

}  // namespace qv::client

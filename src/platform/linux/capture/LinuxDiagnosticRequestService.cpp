#include "platform/linux/capture/LinuxDiagnosticRequestService.h"

#include <fcntl.h>
#include <sys/eventfd.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <fstream>
#include <set>
#include <sstream>
#include <system_error>
#include <vector>

#include <fmt/format.h>

#include "platform/Clock.h"
#include "platform/linux/capture/LinuxConfinedProcess.h"
#include "platform/linux/system/ErrnoText.h"

namespace qv {

namespace {

namespace fs = std::filesystem;

constexpr std::string_view kFilePrefix = "spinlog-";
constexpr std::string_view kDataSuffix = ".perf.data";
constexpr std::string_view kReportSuffix = ".txt";
constexpr std::string_view kLogSuffix = ".log";
// The raw sample may overshoot perf's own size limit by what it writes after noticing.
constexpr std::uint64_t kSampleSlackBytes = 1ull << 20;
// The symbol resolution of perf report is the costly part; it yields to the audio it explains.
constexpr int kReportNiceness = 10;
// A search path for perf and what it runs, independent of the daemon's environment.
constexpr std::string_view kChildPath =
    "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";
// How much of perf's own messages is kept when it fails.
constexpr std::size_t kLogTailBytes = 2048;
constexpr std::size_t kLogTailLines = 3;
// Capability bits of /proc/self/status "CapEff".
constexpr int kCapSysAdmin = 21;
constexpr int kCapPerfmon = 38;

bool isExecutable(const std::string& path) {
    struct stat st {};
    return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) &&
           ::access(path.c_str(), X_OK) == 0;
}

// The path perf runs from, or nothing when there is no such executable.
std::optional<std::string> resolvePerf(const std::string& perf) {
    if (perf.empty()) {
        return std::nullopt;
    }
    if (perf.find('/') != std::string::npos) {
        return isExecutable(perf) ? std::optional<std::string>(perf) : std::nullopt;
    }
    const char* env = ::getenv("PATH");
    std::string search = env != nullptr && *env != '\0' ? env : std::string(kChildPath);
    search += ":";
    search += kChildPath;
    std::stringstream dirs(search);
    std::string dir;
    while (std::getline(dirs, dir, ':')) {
        if (dir.empty()) {
            continue;
        }
        const std::string candidate = dir + "/" + perf;
        if (isExecutable(candidate)) {
            return candidate;
        }
    }
    return std::nullopt;
}

bool hasCapability(int bit) {
    std::ifstream status("/proc/self/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind("CapEff:", 0) == 0) {
            try {
                const unsigned long long caps = std::stoull(line.substr(7), nullptr, 16);
                return ((caps >> bit) & 1) != 0;
            } catch (const std::exception&) {
                return false;
            }
        }
    }
    return false;
}

// Whether perf's messages say that it was not allowed to sample.
bool soundsRefused(const std::string& text) {
    for (const char* sign : {"Permission denied", "perf_event_paranoid", "Operation not permitted",
                             "No permission", "Access to performance monitoring"}) {
        if (text.find(sign) != std::string::npos) {
            return true;
        }
    }
    return false;
}

// The last few lines perf wrote, on one line.
std::string logTail(const fs::path& path) {
    std::ifstream in(path, std::ios::binary);
    if (!in) {
        return "";
    }
    in.seekg(0, std::ios::end);
    const std::streamoff size = in.tellg();
    const std::streamoff from =
        std::max<std::streamoff>(0, size - static_cast<std::streamoff>(kLogTailBytes));
    in.seekg(from);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    std::vector<std::string> lines;
    std::stringstream split(text);
    std::string line;
    while (std::getline(split, line)) {
        std::string clean;
        for (unsigned char c : line) {
            clean += (c >= 0x20 && c != 0x7F) ? static_cast<char>(c) : ' ';
        }
        const auto first = clean.find_first_not_of(' ');
        if (first != std::string::npos) {
            lines.push_back(clean.substr(first));
        }
    }
    if (lines.size() > kLogTailLines) {
        lines.erase(lines.begin(), lines.end() - static_cast<std::ptrdiff_t>(kLogTailLines));
    }
    std::string out;
    for (const auto& l : lines) {
        out += out.empty() ? l : " / " + l;
    }
    return out;
}

std::uint64_t fileSize(const fs::path& path) {
    std::error_code ec;
    const auto size = fs::file_size(path, ec);
    return ec ? 0 : size;
}

std::string seconds(std::chrono::milliseconds window) {
    return fmt::format("{:.3f}", static_cast<double>(window.count()) / 1000.0);
}

// "spinlog-20240131-132501-000007": UTC time first, so names sort by age.
std::string baseName(double now, std::int64_t number) {
    const auto t = std::isfinite(now) && now > 0 ? static_cast<time_t>(now) : time_t{0};
    tm utc{};
    gmtime_r(&t, &utc);
    char stamp[32];
    const std::size_t n = strftime(stamp, sizeof stamp, "%Y%m%d-%H%M%S", &utc);
    return fmt::format("{}{}-{:06}", kFilePrefix, std::string_view(stamp, n), number);
}

int openOutput(const fs::path& path, bool append) {
    return ::open(path.c_str(),
                  O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | (append ? O_APPEND : O_TRUNC),
                  0640);
}

Dictionary optionsDictionary(const DiagnosticRequestOptions& o) {
    return Dictionary{{"sampleStacks", o.sampleStacks},
                      {"callGraphs", o.callGraphs},
                      {"extendedWindow", o.extendedWindow},
                      {"userSpaceOnly", o.userSpaceOnly},
                      {"skipReport", o.skipReport}};
}

}  // namespace

LinuxDiagnosticRequestService::LinuxDiagnosticRequestService(const Clock& clock,
                                                             std::unique_ptr<JsonlSink> sink,
                                                             Options options)
    : clock_(clock),
      sink_(std::move(sink)),
      options_(std::move(options)),
      cancelFd_(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)),
      thread_([this] { run(); }) {}

LinuxDiagnosticRequestService::~LinuxDiagnosticRequestService() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    if (cancelFd_ >= 0) {
        const std::uint64_t one = 1;
        [[maybe_unused]] const ssize_t n = ::write(cancelFd_, &one, sizeof one);
    }
    wake_.notify_all();
    thread_.join();
    if (cancelFd_ >= 0) {
        ::close(cancelFd_);
    }
}

std::optional<std::string> LinuxDiagnosticRequestService::perfUnavailableReason(
    const std::string& perf) {
    if (!resolvePerf(perf)) {
        return perf.find('/') != std::string::npos
                   ? fmt::format("perf is not installed (no executable {})", perf)
                   : fmt::format(
                         "perf is not installed (no {} in the search path; the package "
                         "is linux-perf)",
                         perf);
    }
    std::ifstream paranoidFile("/proc/sys/kernel/perf_event_paranoid");
    int paranoid = 0;
    if (!(paranoidFile >> paranoid)) {
        return std::string(
            "the kernel offers no perf events (no "
            "/proc/sys/kernel/perf_event_paranoid)");
    }
    if (::geteuid() == 0 || hasCapability(kCapPerfmon) || hasCapability(kCapSysAdmin)) {
        return std::nullopt;
    }
    // Sampling every CPU needs the setting at 0 or below when the process has no capability.
    if (paranoid > 0) {
        return fmt::format(
            "perf_event_paranoid is {} and the daemon has neither CAP_PERFMON nor "
            "CAP_SYS_ADMIN, so system-wide samples are refused",
            paranoid);
    }
    return std::nullopt;
}

void LinuxDiagnosticRequestService::request(std::string_view domain, std::string_view kind,
                                            std::string_view description, const Dictionary& payload,
                                            const DiagnosticRequestOptions& options) {
    std::int64_t number = 0;
    std::string reason;
    bool start = false;
    {
        std::lock_guard lock(mutex_);
        number = nextRequest_++;
        ++counters_.requests;
        if (!options.sampleStacks) {
            reason = "no stack sample was asked for";
            ++counters_.notSampledNotAsked;
        } else if (unusable_) {
            reason = *unusable_;
            ++counters_.notSampledUnavailable;
        } else if (stopping_) {
            reason = "the service is stopping";
            ++counters_.notSampledBusy;
        } else if (busy_) {
            reason = "a sample is already being taken";
            ++counters_.notSampledBusy;
        } else {
            busy_ = true;  // reserved: no other request starts one now
            ++counters_.sampled;
            start = true;
        }
    }
    Dictionary line{{"op", "request"},
                    {"request", number},
                    {"domain", domain},
                    {"kind", kind},
                    {"description", description},
                    {"payload", payload},
                    {"options", optionsDictionary(options)},
                    {"sampled", start}};
    if (!start) {
        line.set("reason", reason);
    }
    // The request's line goes first, then the sample is handed on: its result comes after.
    sink_->append(std::move(line));
    if (start) {
        {
            std::lock_guard lock(mutex_);
            job_ = Job{number, options};
        }
        wake_.notify_all();
    }
}

void LinuxDiagnosticRequestService::run() {
    std::unique_lock lock(mutex_);
    for (;;) {
        wake_.wait(lock, [&] { return stopping_ || job_.has_value(); });
        if (!job_) {
            return;
        }
        const Job job = *job_;
        job_.reset();
        const bool stopping = stopping_;
        lock.unlock();
        if (stopping) {
            finish(job.number, Dictionary{{"error", "the service stopped before the sample"}},
                   false);
        } else {
            sample(job);
        }
        lock.lock();
        busy_ = false;
        idle_.notify_all();
    }
}

void LinuxDiagnosticRequestService::finish(std::int64_t number, Dictionary result, bool ok) {
    Dictionary line{{"op", "sample"}, {"request", number}, {"ok", ok}};
    line.merge(result);
    sink_->append(std::move(line));
    if (!ok) {
        std::lock_guard lock(mutex_);
        ++counters_.samplesFailed;
    }
}

void LinuxDiagnosticRequestService::notice(const std::string& message) {
    if (message == lastNotice_) {
        return;
    }
    lastNotice_ = message;
    if (options_.notice) {
        options_.notice(message);
    }
}

void LinuxDiagnosticRequestService::sample(const Job& job) {
    bool probe = false;
    {
        std::lock_guard lock(mutex_);
        probe = !probed_;
        probed_ = true;
    }
    if (probe) {
        if (auto reason = perfUnavailableReason(options_.perf)) {
            std::lock_guard lock(mutex_);
            unusable_ = *reason;
        }
    }
    std::optional<std::string> unusable;
    {
        std::lock_guard lock(mutex_);
        unusable = unusable_;
        if (unusable) {
            // Taken for a sample before perf was found wanting: it counts as not sampled.
            --counters_.sampled;
            ++counters_.notSampledUnavailable;
        }
    }
    if (unusable) {
        notice("stack samples are off: " + *unusable +
               "; diagnostic requests are recorded in the sink only");
        Dictionary line{
            {"op", "sample"}, {"request", job.number}, {"ok", false}, {"error", *unusable}};
        sink_->append(std::move(line));
        return;
    }
    const auto perf = resolvePerf(options_.perf);
    if (!perf) {
        finish(job.number, Dictionary{{"error", "perf is gone from " + options_.perf}}, false);
        return;
    }

    const fs::path& directory = options_.spinlogsDirectory;
    std::error_code ec;
    fs::create_directories(directory, ec);
    if (ec) {
        const std::string error =
            fmt::format("cannot make {}: {}", directory.string(), ec.message());
        notice("stack samples: " + error);
        finish(job.number, Dictionary{{"error", error}}, false);
        return;
    }
    pruneOldSpinlogs();

    const std::string base = baseName(clock_.now(), job.number);
    const fs::path data = directory / (base + std::string(kDataSuffix));
    const fs::path report = directory / (base + std::string(kReportSuffix));
    const fs::path log = directory / (base + std::string(kLogSuffix));
    const int logFd = openOutput(log, true);
    if (logFd < 0) {
        const std::string error = fmt::format("cannot open {}: {}", log.string(), errnoText(errno));
        finish(job.number, Dictionary{{"error", error}}, false);
        return;
    }
    struct Closer {
        int fd;
        ~Closer() { ::close(fd); }
    } logCloser{logFd};

    const std::chrono::milliseconds window =
        job.options.extendedWindow ? options_.extendedSampleWindow : options_.sampleWindow;
    ConfinedCommand record;
    record.program = *perf;
    record.arguments = {"record", "-a"};
    if (job.options.callGraphs) {
        record.arguments.emplace_back("-g");
    }
    if (job.options.userSpaceOnly) {
        record.arguments.emplace_back("--all-user");
    }
    // No build-id cache: it would be written outside the Spinlogs directory.
    record.arguments.insert(
        record.arguments.end(),
        {"--no-buildid-cache",
         fmt::format("--max-size={}K", std::max<std::uint64_t>(options_.maxSampleBytes / 1024, 1)),
         "-o", data.string(), "--", "sleep", seconds(window)});
    record.environment = {"PATH=" + std::string(kChildPath), "HOME=" + directory.string(),
                          "TMPDIR=" + directory.string(), "LC_ALL=C", "PERF_PAGER=cat"};
    record.directory = directory;
    record.standardError = logFd;
    record.maxFileBytes = options_.maxSampleBytes + kSampleSlackBytes;
    record.timeout = window + options_.recordGrace;
    record.killGrace = options_.killGrace;

    const ConfinedResult recorded = runConfined(record, cancelFd_);
    if (!recorded.confined && !confinementNoticed_) {
        confinementNoticed_ = true;
        if (options_.notice) {
            options_.notice("stack samples: perf runs without write confinement: " +
                            QVReportingConfinementUnavailableReason().value_or("unknown reason"));
        }
    }
    auto failed = [&](const ConfinedResult& r, std::string_view what,
                      std::chrono::milliseconds limit) -> std::optional<std::string> {
        switch (r.outcome) {
            case ConfinedResult::Outcome::Exited:
                if (r.status == 0) {
                    return std::nullopt;
                }
                return fmt::format("{} exited with status {}: {}", what, r.status, logTail(log));
            case ConfinedResult::Outcome::Signaled:
                return fmt::format("{} was killed by signal {}: {}", what, r.status, logTail(log));
            case ConfinedResult::Outcome::TimedOut:
                return fmt::format("{} did not finish within {} ms and was stopped", what,
                                   limit.count());
            case ConfinedResult::Outcome::Cancelled:
                return fmt::format("{} was stopped: the service is stopping", what);
            case ConfinedResult::Outcome::StartFailed:
                return r.error;
        }
        return std::string("unknown outcome");
    };
    if (auto error = failed(recorded, "perf record", record.timeout)) {
        if (recorded.outcome == ConfinedResult::Outcome::StartFailed || soundsRefused(*error)) {
            {
                std::lock_guard lock(mutex_);
                unusable_ = "perf refused: " + *error;
            }
            notice("stack samples are off: perf refused: " + *error +
                   "; diagnostic requests are recorded in the sink only");
        } else {
            notice("stack samples: " + *error);
        }
        finish(job.number, Dictionary{{"error", *error}, {"log", log.string()}}, false);
        return;
    }

    Dictionary result{{"data", data.string()},
                      {"log", log.string()},
                      {"seconds", static_cast<double>(window.count()) / 1000.0},
                      {"dataBytes", fileSize(data)}};
    if (!job.options.skipReport) {
        const int reportFd = openOutput(report, false);
        if (reportFd < 0) {
            const std::string error =
                fmt::format("cannot open {}: {}", report.string(), errnoText(errno));
            result.set("error", error);
            finish(job.number, std::move(result), false);
            return;
        }
        Closer reportCloser{reportFd};
        ConfinedCommand reporting;
        reporting.program = *perf;
        reporting.arguments = {"report", "--stdio", "-i", data.string()};
        reporting.environment = record.environment;
        reporting.directory = directory;
        reporting.standardOutput = reportFd;
        reporting.standardError = logFd;
        reporting.maxFileBytes = options_.maxReportBytes;
        reporting.niceness = kReportNiceness;
        reporting.timeout = options_.reportTimeout;
        reporting.killGrace = options_.killGrace;
        const ConfinedResult reported = runConfined(reporting, cancelFd_);
        const std::uint64_t reportBytes = fileSize(report);
        result.set("report", report.string());
        result.set("reportBytes", reportBytes);
        result.set("reportTruncated", reportBytes >= options_.maxReportBytes);
        // A report cut at its bound makes perf fail its writes; what it wrote stands.
        if (auto error = failed(reported, "perf report", reporting.timeout);
            error && reportBytes < options_.maxReportBytes) {
            notice("stack samples: " + *error);
            result.set("error", *error);
            finish(job.number, std::move(result), false);
            return;
        }
    }
    lastNotice_.clear();
    finish(job.number, std::move(result), true);
}

void LinuxDiagnosticRequestService::pruneOldSpinlogs() {
    std::set<std::string> bases;
    std::error_code ec;
    for (const auto& entry : fs::directory_iterator(options_.spinlogsDirectory, ec)) {
        const std::string name = entry.path().filename().string();
        if (name.rfind(kFilePrefix, 0) == 0) {
            bases.insert(name.substr(0, name.find('.')));
        }
    }
    // Room for the group about to be written.
    const std::size_t keep = options_.maxKeptSpinlogs > 0 ? options_.maxKeptSpinlogs - 1 : 0;
    while (bases.size() > keep) {
        const std::string oldest = *bases.begin();
        bases.erase(bases.begin());
        for (const auto suffix : {kDataSuffix, kReportSuffix, kLogSuffix}) {
            fs::remove(options_.spinlogsDirectory / (oldest + std::string(suffix)), ec);
        }
        // perf keeps the previous sample as ".old" when a name is reused.
        fs::remove(options_.spinlogsDirectory / (oldest + std::string(kDataSuffix) + ".old"), ec);
    }
}

void LinuxDiagnosticRequestService::flush() {
    {
        std::unique_lock lock(mutex_);
        idle_.wait(lock, [&] { return !busy_; });
    }
    sink_->flush();
}

LinuxDiagnosticRequestService::Counters LinuxDiagnosticRequestService::counters() const {
    std::lock_guard lock(mutex_);
    return counters_;
}

}  // namespace qv

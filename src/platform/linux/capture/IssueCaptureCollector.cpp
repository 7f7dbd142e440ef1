#include "platform/linux/capture/IssueCaptureCollector.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <systemd/sd-journal.h>

#include <fmt/format.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>
#include <ctime>
#include <set>
#include <string_view>

#include "platform/IssueCaptureService.h"
#include "platform/PosixIO.h"
#include "platform/linux/system/ErrnoText.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

// Linux never hands out a process ID above this (PID_MAX_LIMIT on 64-bit systems).
constexpr std::int64_t kMaxProcessID = 4194304;
// Journal text is written in pieces of this size, not line by line.
constexpr std::size_t kWriteChunk = 64 * 1024;
// The name the kernel keeps for a process is cut to this many bytes.
constexpr std::size_t kCommLength = 15;

std::string isoTime(double secondsSince1970) {
    if (!std::isfinite(secondsSince1970)) {
        return "?";
    }
    const auto whole = static_cast<std::time_t>(std::floor(secondsSince1970));
    const auto micros =
        static_cast<long>(std::llround((secondsSince1970 - static_cast<double>(whole)) * 1e6));
    std::tm tm{};
    gmtime_r(&whole, &tm);
    return fmt::format("{:04}-{:02}-{:02}T{:02}:{:02}:{:02}.{:06}Z", tm.tm_year + 1900,
                       tm.tm_mon + 1, tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec,
                       std::min(micros, 999999L));
}

// Control bytes would break the one-line-per-entry layout; tabs stay.
std::string printable(std::string_view text, std::size_t maxBytes) {
    std::string out;
    const bool cut = text.size() > maxBytes;
    text = text.substr(0, maxBytes);
    out.reserve(text.size() + 4);
    for (const char c : text) {
        const auto u = static_cast<unsigned char>(c);
        out.push_back((u < 0x20 && c != '\t') || u == 0x7F ? ' ' : c);
    }
    if (cut) {
        out += " [...]";
    }
    return out;
}

struct Note {
    std::string what;
    std::string why;
};

struct Processes {
    std::vector<std::int64_t> pids;
    std::string name;  // set when the processes were found by name
};

const Array* processIDsOf(const std::optional<Dictionary>& payload) {
    if (!payload) {
        return nullptr;
    }
    const Value* parameters = payload->find(kIssueCaptureKeyPayloadDEParameters);
    const Dictionary* extensions = parameters ? parameters->asDictionary() : nullptr;
    if (!extensions) {
        return nullptr;
    }
    for (const auto& [extension, value] : *extensions) {
        const Dictionary* settings = value.asDictionary();
        const Value* ids = settings ? settings->find("processIDs") : nullptr;
        if (ids) {
            return ids->asArray();
        }
    }
    return nullptr;
}

std::optional<std::int64_t> processID(const Value& value) {
    if (const auto d = value.asDouble(); d && value.kind() == Value::Kind::Double) {
        if (!std::isfinite(*d) || std::floor(*d) != *d || *d < 1 ||
            *d > static_cast<double>(kMaxProcessID)) {
            return std::nullopt;
        }
        return static_cast<std::int64_t>(*d);
    }
    if (value.kind() != Value::Kind::Int && value.kind() != Value::Kind::UInt) {
        return std::nullopt;
    }
    const auto n = value.asInt64();
    if (!n || *n < 1 || *n > kMaxProcessID) {
        return std::nullopt;
    }
    return n;
}

std::optional<std::string> readSmallFile(const std::string& path, std::size_t maxBytes,
                                         int& error) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        error = errno;
        return std::nullopt;
    }
    std::string text(maxBytes, '\0');
    std::size_t got = 0;
    while (got < maxBytes) {
        const ssize_t n = ::read(fd, text.data() + got, maxBytes - got);
        if (n < 0 && errno == EINTR) {
            continue;
        }
        if (n < 0) {
            error = errno;
            ::close(fd);
            return std::nullopt;
        }
        if (n == 0) {
            break;
        }
        got += static_cast<std::size_t>(n);
    }
    ::close(fd);
    text.resize(got);
    return text;
}

// Live processes whose kernel name is name, in /proc order.
std::vector<std::int64_t> processesNamed(const std::string& name) {
    std::vector<std::int64_t> found;
    DIR* dir = ::opendir("/proc");
    if (!dir) {
        return found;
    }
    const std::string wanted = name.substr(0, kCommLength);
    while (const dirent* entry = ::readdir(dir)) {
        char* end = nullptr;
        const long pid = std::strtol(entry->d_name, &end, 10);
        if (pid <= 0 || *end != '\0') {
            continue;
        }
        int error = 0;
        auto comm = readSmallFile(fmt::format("/proc/{}/comm", pid), 64, error);
        if (!comm) {
            continue;
        }
        while (!comm->empty() && comm->back() == '\n') {
            comm->pop_back();
        }
        if (*comm == wanted) {
            found.push_back(pid);
            if (found.size() >= IssueCaptureJob::kMaxProcesses) {
                break;
            }
        }
    }
    ::closedir(dir);
    return found;
}

Processes processesOf(const IssueCaptureJob& job, std::vector<Note>& notes) {
    Processes out;
    std::set<std::int64_t> seen;
    if (const Array* ids = processIDsOf(job.payload)) {
        for (std::size_t i = 0; i < ids->size(); ++i) {
            const auto pid = processID((*ids)[i]);
            if (!pid) {
                notes.push_back({fmt::format("processIDs[{}]", i),
                                 fmt::format("not a process ID: {}", (*ids)[i].description())});
                continue;
            }
            if (out.pids.size() >= IssueCaptureJob::kMaxProcesses) {
                notes.push_back(
                    {fmt::format("processIDs[{}]", i),
                     fmt::format("more than {} processes named", IssueCaptureJob::kMaxProcesses)});
                break;
            }
            if (seen.insert(*pid).second) {
                out.pids.push_back(*pid);
            }
        }
    }
    if (!out.pids.empty()) {
        return out;
    }
    const Value* detected = job.signature.find(kIssueCaptureSignatureDetectedProcess);
    const std::string* name = detected ? detected->asString() : nullptr;
    if (name && !name->empty() && *name != "Unknown") {
        out.name = *name;
        out.pids = processesNamed(*name);
        if (out.pids.empty()) {
            notes.push_back({"status of " + *name, "no live process of that name"});
        }
    } else {
        notes.push_back({"processes", "the request names no process"});
    }
    return out;
}

// A file of the capture: written whole, or not at all.
class CaptureFile {
  public:
    explicit CaptureFile(const std::filesystem::path& path) : path_(path) {
        fd_ = ::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC | O_NOFOLLOW, 0640);
        if (fd_ < 0) {
            error_ = errno;
        }
    }
    ~CaptureFile() { close(); }
    CaptureFile(const CaptureFile&) = delete;
    CaptureFile& operator=(const CaptureFile&) = delete;

    void append(std::string_view text) {
        buffer_.append(text);
        if (buffer_.size() >= kWriteChunk) {
            drain();
        }
    }
    // Writes what is buffered and closes; the error of the first failure, 0 when none.
    int close() {
        if (fd_ >= 0) {
            drain();
            error_ = syncAndClose(fd_, error_);  // on disk before a manifest is renamed in
            fd_ = -1;
        }
        return error_;
    }
    int error() const { return error_; }

  private:
    void drain() {
        if (fd_ >= 0 && error_ == 0 && !writeAll(fd_, buffer_)) {
            error_ = errno;
        }
        buffer_.clear();
    }

    std::filesystem::path path_;
    int fd_ = -1;
    int error_ = 0;
    std::string buffer_;
};

struct JournalResult {
    std::size_t lines = 0;
    std::size_t bytes = 0;
    bool truncated = false;
    std::optional<std::string> error;  // why nothing could be read
};

std::string journalField(sd_journal* j, const char* field) {
    const void* data = nullptr;
    size_t length = 0;
    if (sd_journal_get_data(j, field, &data, &length) < 0) {
        return {};
    }
    std::string_view text(static_cast<const char*>(data), length);
    const std::size_t prefix = std::strlen(field) + 1;  // "FIELD="
    return std::string(text.size() >= prefix ? text.substr(prefix) : std::string_view());
}

JournalResult readJournal(const IssueCaptureJob& job, const Processes& processes,
                          std::size_t budget, CaptureFile& out) {
    JournalResult result;
    sd_journal* j = nullptr;
    int r = job.journalDirectory ? sd_journal_open_directory(&j, job.journalDirectory->c_str(), 0)
                                 : sd_journal_open(&j, SD_JOURNAL_LOCAL_ONLY);
    if (r < 0) {
        result.error = "cannot open the journal: " + errnoText(-r);
        return result;
    }
    std::uint64_t usage = 0;
    if (sd_journal_get_usage(j, &usage) >= 0 && usage == 0) {
        sd_journal_close(j);
        result.error = job.journalDirectory
                           ? "no journal files in " + *job.journalDirectory
                           : std::string("no journal files to read (is journald running?)");
        return result;
    }
    sd_journal_set_data_threshold(j, IssueCaptureJob::kMaxMessageBytes + 64);
    // Matches on one field are alternatives; the name is a further alternative.
    for (const std::int64_t pid : processes.pids) {
        const std::string match = fmt::format("_PID={}", pid);
        sd_journal_add_match(j, match.data(), match.size());
    }
    if (job.daemonPid > 0) {
        const std::string match = fmt::format("_PID={}", job.daemonPid);
        sd_journal_add_match(j, match.data(), match.size());
    }
    if (!processes.name.empty()) {
        sd_journal_add_disjunction(j);
        const std::string match = "_COMM=" + processes.name.substr(0, kCommLength);
        sd_journal_add_match(j, match.data(), match.size());
    }
    const auto from = static_cast<std::uint64_t>(std::max(0.0, job.windowFrom) * 1e6);
    const auto to = static_cast<std::uint64_t>(std::max(0.0, job.windowTo) * 1e6);
    r = sd_journal_seek_realtime_usec(j, from);
    if (r < 0) {
        sd_journal_close(j);
        result.error = "cannot seek in the journal: " + errnoText(-r);
        return result;
    }
    while ((r = sd_journal_next(j)) > 0) {
        std::uint64_t at = 0;
        if (sd_journal_get_realtime_usec(j, &at) < 0 || at < from) {
            continue;
        }
        if (at > to) {
            break;
        }
        std::string ident = journalField(j, "SYSLOG_IDENTIFIER");
        if (ident.empty()) {
            ident = journalField(j, "_COMM");
        }
        const std::string line = fmt::format(
            "{} {}[{}]: {}\n", isoTime(static_cast<double>(at) / 1e6),
            printable(ident.empty() ? "?" : ident, 64), printable(journalField(j, "_PID"), 16),
            printable(journalField(j, "MESSAGE"), IssueCaptureJob::kMaxMessageBytes));
        if (result.lines >= job.maxJournalLines || result.bytes + line.size() > budget) {
            result.truncated = true;
            break;
        }
        out.append(line);
        ++result.lines;
        result.bytes += line.size();
    }
    if (r < 0 && result.lines == 0) {
        result.error = "cannot read the journal: " + errnoText(-r);
    }
    sd_journal_close(j);
    return result;
}

bool writeManifest(const std::filesystem::path& directory, const nlohmann::ordered_json& manifest,
                   std::string& problem) {
    const auto path = directory / "manifest.json";
    const auto temp = directory / "manifest.json.tmp";
    std::string text;
    try {
        text = manifest.dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace);
    } catch (const std::exception& e) {
        problem = fmt::format("{}: {}", path.string(), e.what());
        return false;
    }
    text.push_back('\n');
    {
        CaptureFile file(temp);
        file.append(text);
        if (const int error = file.close()) {
            problem = fmt::format("{}: {}", temp.string(), errnoText(error));
            ::unlink(temp.c_str());
            return false;
        }
    }
    if (::rename(temp.c_str(), path.c_str()) != 0) {
        problem = fmt::format("{}: {}", path.string(), errnoText(errno));
        ::unlink(temp.c_str());
        return false;
    }
    return true;
}

}  // namespace

IssueCaptureOutcome QVReportingCollectIssueCapture(const IssueCaptureJob& job, double completedAt) {
    IssueCaptureOutcome outcome;
    auto& manifest = outcome.manifest;
    manifest["id"] = job.id;
    manifest["kind"] = job.kind;
    manifest["signature"] = QVReportingDictionaryToJson(job.signature);
    manifest["duration"] = std::isfinite(job.duration) ? nlohmann::ordered_json(job.duration)
                                                       : nlohmann::ordered_json();
    manifest["requested"] = job.requested;
    manifest["completed"] = completedAt;
    manifest["window"] = {{"from", job.windowFrom}, {"to", job.windowTo}};

    std::error_code ec;
    std::filesystem::create_directories(job.directory, ec);
    if (ec) {
        outcome.problems.push_back(fmt::format("issue capture {}: cannot make {}: {}", job.id,
                                               job.directory.string(), ec.message()));
        return outcome;
    }

    std::vector<Note> notes;
    nlohmann::ordered_json collected = nlohmann::ordered_json::array();
    const Processes processes = processesOf(job, notes);
    manifest["processIDs"] = processes.pids;
    if (!processes.name.empty()) {
        manifest["processName"] = processes.name;
    }
    manifest["daemonPID"] = job.daemonPid;

    std::size_t budget = job.maxBytes;
    for (const std::int64_t pid : processes.pids) {
        const std::string source = fmt::format("/proc/{}/status", pid);
        int error = 0;
        const auto status = readSmallFile(source, IssueCaptureJob::kMaxStatusBytes, error);
        if (!status) {
            notes.push_back({source, error == ENOENT || error == ESRCH
                                         ? "no such process (not alive)"
                                         : errnoText(error)});
            continue;
        }
        if (status->size() > budget) {
            notes.push_back({source, "the capture's byte limit is used up"});
            continue;
        }
        const std::string name = fmt::format("status-{}.txt", pid);
        CaptureFile file(job.directory / name);
        file.append(*status);
        if (const int werror = file.close()) {
            notes.push_back({source, fmt::format("writing {}: {}", name, errnoText(werror))});
            outcome.problems.push_back(
                fmt::format("issue capture {}: writing {}: {}", job.id, name, errnoText(werror)));
            continue;
        }
        budget -= status->size();
        collected.push_back({{"file", name}, {"what", source}, {"bytes", status->size()}});
    }

    {
        const std::string name = "journal.txt";
        CaptureFile file(job.directory / name);
        nlohmann::ordered_json journal;
        journal["source"] = job.journalDirectory ? *job.journalDirectory : std::string("local");
        if (file.error() != 0) {
            notes.push_back(
                {"journal", fmt::format("writing {}: {}", name, errnoText(file.error()))});
            outcome.problems.push_back(fmt::format("issue capture {}: writing {}: {}", job.id, name,
                                                   errnoText(file.error())));
        } else {
            const JournalResult read = readJournal(job, processes, budget, file);
            const int werror = file.close();
            if (read.error) {
                notes.push_back({"journal", *read.error});
                journal["error"] = *read.error;
                std::filesystem::remove(job.directory / name, ec);  // empty: nothing was read
            }
            if (werror != 0) {
                notes.push_back(
                    {"journal", fmt::format("writing {}: {}", name, errnoText(werror))});
                outcome.problems.push_back(fmt::format("issue capture {}: writing {}: {}", job.id,
                                                       name, errnoText(werror)));
            } else if (!read.error) {
                journal["file"] = name;
                journal["lines"] = read.lines;
                journal["bytes"] = read.bytes;
                journal["truncated"] = read.truncated;
                collected.push_back({{"file", name},
                                     {"what", "journal lines of the processes and the daemon"},
                                     {"lines", read.lines},
                                     {"bytes", read.bytes},
                                     {"truncated", read.truncated}});
            }
        }
        manifest["journal"] = journal;
    }

    manifest["collected"] = collected;
    nlohmann::ordered_json missing = nlohmann::ordered_json::array();
    for (const Note& note : notes) {
        missing.push_back({{"what", note.what}, {"why", note.why}});
    }
    manifest["notCollected"] = missing;

    std::string problem;
    outcome.manifestWritten = writeManifest(job.directory, manifest, problem);
    if (!outcome.manifestWritten) {
        outcome.problems.push_back(fmt::format("issue capture {}: {}", job.id, problem));
    }
    return outcome;
}

}  // namespace qv

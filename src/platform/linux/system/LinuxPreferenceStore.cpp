#include "platform/linux/system/LinuxPreferenceStore.h"
#include "platform/linux/system/ErrnoText.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <nlohmann/json.hpp>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <utility>

#include "platform/PosixIO.h"
#include "platform/SafeFileName.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

// A defaults file is a handful of switches; anything this large is not one of ours.
constexpr off_t kMaximumFileSize = 16 * 1024 * 1024;
// Deeper JSON is refused before it is parsed and converted, both of which recurse.
constexpr int kMaximumNesting = 64;
// A copy of a file modified less than this long before it was read may hide a later rewrite
// within the same timestamp tick.
constexpr double kTrustAfterSeconds = 1.0;

// Closes a descriptor on every path out of a scope.
class FileDescriptor {
  public:
    explicit FileDescriptor(int fd) : fd_(fd) {}
    ~FileDescriptor() {
        if (fd_ >= 0) {
            ::close(fd_);
        }
    }
    FileDescriptor(const FileDescriptor&) = delete;
    FileDescriptor& operator=(const FileDescriptor&) = delete;
    int get() const { return fd_; }
    // Closes now and says whether close succeeded (it can report a deferred write error).
    bool close() {
        const int fd = std::exchange(fd_, -1);
        return fd < 0 || ::close(fd) == 0;
    }

  private:
    int fd_;
};

double secondsOf(const timespec& ts) {
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

double realNow() {
    timespec ts{};
    clock_gettime(CLOCK_REALTIME, &ts);
    return secondsOf(ts);
}

// Reads the whole file; false with errno set when it cannot.
bool readAll(int fd, std::string& out) {
    char buffer[16384];
    for (;;) {
        const ssize_t n = ::read(fd, buffer, sizeof buffer);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        if (n == 0) {
            return true;
        }
        out.append(buffer, static_cast<std::size_t>(n));
        if (static_cast<off_t>(out.size()) > kMaximumFileSize) {
            errno = EFBIG;
            return false;
        }
    }
}

const Dictionary& emptyDictionary() {
    static const Dictionary empty;
    return empty;
}

}  // namespace

bool LinuxPreferenceStore::Identity::operator==(const Identity& other) const {
    return device == other.device && inode == other.inode && size == other.size &&
           modified.tv_sec == other.modified.tv_sec && modified.tv_nsec == other.modified.tv_nsec;
}

LinuxPreferenceStore::LinuxPreferenceStore(std::string stateDir, ErrorCallback onError,
                                           std::function<void()> onFileRefused)
    : directory_(std::move(stateDir) + "/defaults"),
      onError_(std::move(onError)),
      onFileRefused_(std::move(onFileRefused)) {
    Problems problems;
    ensureDirectory(problems);
    report(problems);
}

std::string LinuxPreferenceStore::pathForSuite(std::string_view suite) const {
    return directory_ + "/" + QVReportingSafeFileComponent(suite) + ".json";
}

std::optional<Value> LinuxPreferenceStore::value(std::string_view suite,
                                                 std::string_view key) const {
    Problems problems;
    std::optional<Value> result;
    {
        std::lock_guard lock(mutex_);
        if (const Value* v = loadLocked(pathForSuite(suite), problems).find(key)) {
            result = *v;
        }
    }
    report(problems);
    return result;
}

Dictionary LinuxPreferenceStore::values(std::string_view suite) const {
    Problems problems;
    Dictionary result;
    {
        std::lock_guard lock(mutex_);
        result = loadLocked(pathForSuite(suite), problems);
    }
    report(problems);
    return result;
}

bool LinuxPreferenceStore::setValue(std::string_view suite, std::string_view key,
                                    const Value& value) {
    Problems problems;
    bool ok = false;
    {
        std::lock_guard lock(mutex_);
        ok = modifyLocked(
            suite,
            [&](Dictionary& values) {
                if (const Value* old = values.find(key);
                    old && *old == value && old->kind() == value.kind()) {
                    return false;
                }
                values.set(key, value);
                return true;
            },
            problems);
    }
    report(problems);
    return ok;
}

bool LinuxPreferenceStore::removeValue(std::string_view suite, std::string_view key) {
    Problems problems;
    bool ok = false;
    {
        std::lock_guard lock(mutex_);
        ok = modifyLocked(
            suite, [&](Dictionary& values) { return values.erase(key); }, problems);
    }
    report(problems);
    return ok;
}

const Dictionary& LinuxPreferenceStore::loadLocked(const std::string& path, Problems& problems,
                                                   bool* intact) const {
    if (intact != nullptr) {
        *intact = true;
    }
    FileDescriptor fd(
        ::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK | O_NOFOLLOW));
    const int openError = fd.get() < 0 ? errno : 0;
    if (openError == ENOENT) {
        cache_.erase(path);
        return emptyDictionary();
    }
    struct stat info {};
    // An unopenable file is still identified, so that its problem is reported once.
    if ((fd.get() < 0 ? ::stat(path.c_str(), &info) : ::fstat(fd.get(), &info)) != 0) {
        info = {};
    }
    const Identity identity{info.st_dev, info.st_ino, info.st_size, info.st_mtim};

    auto it = cache_.find(path);
    const bool seen = it != cache_.end() && it->second.identity == identity;
    if (seen && it->second.trusted) {
        if (intact != nullptr) {
            *intact = it->second.problem.empty();
        }
        return it->second.values;
    }

    CachedSuite entry;
    entry.identity = identity;
    entry.trusted = realNow() - secondsOf(identity.modified) >= kTrustAfterSeconds;
    std::string text;
    if (fd.get() < 0 && openError == ELOOP) {
        entry.problem = path + " is a symbolic link";
        entry.refused = true;
    } else if (fd.get() < 0) {
        entry.problem = "cannot open " + path + ": " + errnoText(openError);
    } else if (!S_ISREG(info.st_mode)) {
        entry.problem = path + " is not a regular file";
        entry.refused = true;
    } else if (info.st_size > kMaximumFileSize) {
        entry.problem = path + " is too large to be a defaults file";
        entry.refused = true;
    } else if (!readAll(fd.get(), text)) {
        entry.problem = "cannot read " + path + ": " + errnoText(errno);
    } else if (text.find('\0') != std::string::npos) {
        // JSON text holds no NUL, and the parser would take one for the end of the file.
        entry.problem = path + " is not valid JSON";
    } else if (QVReportingJsonNestsDeeperThan(text, kMaximumNesting)) {
        entry.problem = path + " is nested too deeply";
    } else {
        const auto json = nlohmann::ordered_json::parse(text, nullptr, /*allow_exceptions=*/false);
        if (json.is_discarded()) {
            entry.problem = path + " is not valid JSON";
        } else if (!json.is_object()) {
            entry.problem = path + " does not hold a JSON object";
        } else {
            entry.values = QVReportingDictionaryFromJson(json);
        }
    }
    if (!entry.problem.empty()) {
        if (!seen || it->second.problem != entry.problem) {
            problems.push_back(entry.problem + "; it reads as empty");
            if (entry.refused && onFileRefused_) {
                onFileRefused_();
            }
        }
        if (intact != nullptr) {
            *intact = false;
        }
    }
    auto& stored = cache_[path];
    stored = std::move(entry);
    return stored.values;
}

bool LinuxPreferenceStore::modifyLocked(std::string_view suite,
                                        const std::function<bool(Dictionary&)>& edit,
                                        Problems& problems) {
    if (!ensureDirectory(problems)) {
        return false;
    }
    FileDescriptor dir(::open(directory_.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (dir.get() < 0) {
        problems.push_back("cannot open " + directory_ + ": " + errnoText(errno));
        return false;
    }
    // Other processes (the command-line client) write these files too.
    while (::flock(dir.get(), LOCK_EX) != 0) {
        if (errno != EINTR) {
            problems.push_back("cannot lock " + directory_ + ": " + errnoText(errno));
            return false;
        }
    }
    const std::string path = pathForSuite(suite);
    // Read what is on disk now, not what was seen before the lock.
    auto cached = cache_.find(path);
    if (cached != cache_.end()) {
        cached->second.trusted = false;
    }
    bool intact = true;
    Dictionary values = loadLocked(path, problems, &intact);
    if (!intact) {
        // Replacing a file that could not be read would throw away whatever else it holds.
        problems.push_back(path + " is left as it is; the change to it is not written");
        return false;
    }
    if (!edit(values)) {
        return true;
    }
    const bool written = writeFileLocked(path, values, problems);
    cache_.erase(path);
    if (written && ::fsync(dir.get()) != 0) {
        // The new contents are in place; only their survival of a power cut is in doubt.
        problems.push_back("cannot sync " + directory_ + ": " + errnoText(errno));
    }
    return written;  // the lock goes with the descriptor
}

bool LinuxPreferenceStore::writeFileLocked(const std::string& path, const Dictionary& values,
                                           Problems& problems) {
    std::string text;
    try {
        text = QVReportingDictionaryToJson(values).dump(
                   2, ' ', false, nlohmann::ordered_json::error_handler_t::replace) +
               "\n";
    } catch (const std::exception& e) {
        problems.push_back("cannot encode " + path + ": " + e.what());
        return false;
    }
    // A leading "." keeps the temporary file apart from every suite file (safe names never
    // start with one).
    const std::string name = path.substr(directory_.size() + 1);
    std::string temp = directory_ + "/." + name + ".XXXXXX";
    FileDescriptor fd(::mkostemp(temp.data(), O_CLOEXEC));
    if (fd.get() < 0) {
        problems.push_back("cannot create a file in " + directory_ + ": " + errnoText(errno));
        return false;
    }
    const char* step = nullptr;
    if (!writeAll(fd.get(), text)) {
        step = "write";
    } else if (::fchmod(fd.get(), 0644) != 0) {
        step = "chmod";
    } else if (::fsync(fd.get()) != 0) {
        step = "sync";
    } else if (!fd.close()) {
        step = "close";
    } else if (::rename(temp.c_str(), path.c_str()) != 0) {
        step = "rename";
    }
    if (step != nullptr) {
        problems.push_back(std::string("cannot ") + step + " " + temp + " for " + path + ": " +
                           errnoText(errno));
        ::unlink(temp.c_str());
        return false;
    }
    return true;
}

bool LinuxPreferenceStore::ensureDirectory(Problems& problems) const {
    std::error_code ec;
    std::filesystem::create_directories(directory_, ec);
    if (ec || !std::filesystem::is_directory(directory_, ec)) {
        problems.push_back("cannot create " + directory_ + ": " +
                           (ec ? ec.message() : std::string("not a directory")));
        return false;
    }
    return true;
}

void LinuxPreferenceStore::report(const Problems& problems) const {
    if (!onError_) {
        return;
    }
    for (const std::string& problem : problems) {
        onError_(problem);
    }
}

}  // namespace qv

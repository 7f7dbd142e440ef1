// The preference store on Linux: one JSON object per suite or domain in
// <stateDir>/defaults/<SUITE>.json, where SUITE is the name made safe with
// QVReportingSafeFileComponent (so a hostile name can neither leave the directory nor clash with
// another suite's file).
//
// Writes replace the file atomically (a temporary file in the same directory, fsync, rename,
// fsync of the directory). Writers in this process are serialised by a mutex, and writers of all
// processes by an exclusive flock() on the defaults directory, which the command-line client
// takes too; a write reads the file afresh under both, so no one's change is lost.
//
// Reads use a parsed copy of each file, kept until the file changes: every read compares the
// file's inode, size and modification time with those of the copy. A copy read less than a
// second after the file was modified is not trusted (a rewrite within the same timestamp tick
// could look unchanged) and is read again next time.
//
// A missing, unreadable or malformed file reads as an empty suite; what went wrong is reported
// once per version of the file through the error callback, never thrown. A change to a suite
// whose file exists but cannot be read or parsed is refused rather than written over it, so a
// slip in a hand-edited file never costs the rest of its settings.
//
// Thread safety: every member may be called from any thread.
#pragma once

#include <ctime>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include <sys/types.h>

#include "platform/PreferenceStore.h"

namespace qv {

class LinuxPreferenceStore final : public PreferenceStore {
  public:
    using ErrorCallback = std::function<void(const std::string& message)>;

    // Creates <stateDir>/defaults when it is missing (and again before a write, should it go
    // away). onError, when set, hears of every problem; it may be called from any thread that
    // uses the store, never with the store's lock held. onFileRefused hears of each defaults
    // file newly refused for what it is (a link, not a regular file, too large); it may be called
    // with the lock held, so it must not use the store.
    explicit LinuxPreferenceStore(std::string stateDir, ErrorCallback onError = {},
                                  std::function<void()> onFileRefused = {});

    LinuxPreferenceStore(const LinuxPreferenceStore&) = delete;
    LinuxPreferenceStore& operator=(const LinuxPreferenceStore&) = delete;

    std::optional<Value> value(std::string_view suite, std::string_view key) const override;
    Dictionary values(std::string_view suite) const override;
    bool setValue(std::string_view suite, std::string_view key, const Value& value) override;
    bool removeValue(std::string_view suite, std::string_view key) override;

    // The directory holding the suite files.
    const std::string& directory() const { return directory_; }
    // The file of a suite or domain (it need not exist).
    std::string pathForSuite(std::string_view suite) const;

  private:
    // What a file looked like when it was parsed.
    struct Identity {
        dev_t device = 0;
        ino_t inode = 0;
        off_t size = 0;
        timespec modified{};
        bool operator==(const Identity& other) const;
    };
    struct CachedSuite {
        Identity identity;
        bool trusted = false;  // false: read again even when the identity matches
        Dictionary values;
        std::string problem;   // why the file reads as empty, when it could not be used
        bool refused = false;  // for what it is, not for what it holds
    };
    using Problems = std::vector<std::string>;

    // The suite's current contents, from the copy or from the file; intact, when given, tells
    // whether the file was missing or usable (false: it exists but could not be read or parsed).
    // REQUIRES: mutex_ held.
    const Dictionary& loadLocked(const std::string& path, Problems& problems,
                                 bool* intact = nullptr) const;
    // Reads the file afresh, applies edit and writes the result back. REQUIRES: mutex_ held.
    bool modifyLocked(std::string_view suite, const std::function<bool(Dictionary&)>& edit,
                      Problems& problems);
    bool writeFileLocked(const std::string& path, const Dictionary& values, Problems& problems);
    bool ensureDirectory(Problems& problems) const;
    void report(const Problems& problems) const;

    const std::string directory_;
    const ErrorCallback onError_;
    const std::function<void()> onFileRefused_;
    mutable std::mutex mutex_;
    mutable std::map<std::string, CachedSuite, std::less<>> cache_;  // by path; guarded by mutex_
};

}  // namespace qv

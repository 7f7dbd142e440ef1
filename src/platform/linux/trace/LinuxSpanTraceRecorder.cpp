#include "platform/linux/trace/LinuxSpanTraceRecorder.h"
#include "platform/linux/system/ErrnoText.h"

#include <dirent.h>
#include <fcntl.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <mutex>
#include <set>
#include <thread>

#include <fmt/format.h>

#include "platform/PosixIO.h"
#include "platform/linux/trace/TracefsFiles.h"

namespace qv {

namespace {

namespace fs = std::filesystem;

using tracefs::instanceOwner;
using tracefs::isTracefs;
using tracefs::kInstancePrefix;
using tracefs::processStartTime;
using tracefs::readSmall;
using tracefs::writeControl;

constexpr std::size_t kCopyChunk = 1024 * 1024;
// An instance held open by some program is tried again this often before it is left for later.
constexpr int kRemoveAttempts = 5;
constexpr auto kRemovePause = std::chrono::milliseconds(20);

}  // namespace

// One recording: its state, shared between the session object and the recorder's thread.
struct Recording {
    enum class State { Created, Starting, Running, Failed, Stopping, Done };

    SpanTraceConfiguration configuration;
    std::mutex mutex;
    State state = State::Created;               // guarded by mutex
    std::weak_ptr<SpanTraceDelegate> delegate;  // guarded by mutex
    // Set on the recorder's thread only.
    std::string name;
    fs::path root;
    fs::path instance;
    std::string clock = "local";

    std::shared_ptr<SpanTraceDelegate> currentDelegate() {
        std::lock_guard lock(mutex);
        return delegate.lock();
    }
    void setState(State s) {
        std::lock_guard lock(mutex);
        state = s;
    }
    State getState() {
        std::lock_guard lock(mutex);
        return state;
    }
};

struct LinuxSpanTraceRecorder::Core {
    Core(Options o, std::function<void(const std::string&)> p)
        : options(std::move(o)), problem(std::move(p)), thread([this] { run(); }) {}

    ~Core() { shutDownAndJoin(); }

    // Ends the thread once the work queued so far is done. Called by the recorder's destructor,
    // so that the join never happens on the recorder's own thread (a session released there may
    // hold the last reference to the core).
    void shutDownAndJoin() {
        {
            std::lock_guard lock(mutex);
            stopping = true;
        }
        wake.notify_all();
        if (thread.joinable() && thread.get_id() != std::this_thread::get_id()) {
            thread.join();
        }
    }

    // Queues work for the recorder's thread; false once the recorder is going.
    bool post(std::function<void()> task) {
        {
            std::lock_guard lock(mutex);
            if (stopping) {
                return false;
            }
            tasks.push_back(std::move(task));
        }
        wake.notify_one();
        return true;
    }

    void drain() {
        std::unique_lock lock(mutex);
        const std::uint64_t target = posted();
        idle.wait(lock, [&] { return done >= target; });
    }

    void run() {
        std::unique_lock lock(mutex);
        for (;;) {
            wake.wait(lock, [&] { return stopping || !tasks.empty(); });
            if (tasks.empty()) {
                break;
            }
            auto task = std::move(tasks.front());
            tasks.pop_front();
            ++running;
            lock.unlock();
            task();
            lock.lock();
            --running;
            ++done;
            idle.notify_all();
        }
        lock.unlock();
        shutDown();
    }
    // REQUIRES: mutex held.
    std::uint64_t posted() const { return done + running + tasks.size(); }

    void report(const std::string& text) {
        if (problem) {
            problem(text);
        }
    }

    // The tracefs root, or why there is none.
    std::optional<fs::path> findRoot(std::string& error) {
        if (!options.tracefsRoot.empty()) {
            if (isTracefs(options.tracefsRoot)) {
                return options.tracefsRoot;
            }
            error = fmt::format("{} is not a mounted tracefs", options.tracefsRoot.string());
            return std::nullopt;
        }
        for (const char* candidate : {"/sys/kernel/tracing", "/sys/kernel/debug/tracing"}) {
            if (isTracefs(candidate)) {
                return fs::path(candidate);
            }
        }
        error = "tracefs is not mounted (tried /sys/kernel/tracing and /sys/kernel/debug/tracing)";
        return std::nullopt;
    }

    // Removes an instance, trying again for a moment while a program holds one of its files.
    int removeInstance(const fs::path& instance) {
        for (int attempt = 0;; ++attempt) {
            if (::rmdir(instance.c_str()) == 0 || errno == ENOENT) {
                return 0;
            }
            if (errno != EBUSY || attempt + 1 >= kRemoveAttempts) {
                return errno;
            }
            std::this_thread::sleep_for(kRemovePause);
        }
    }

    // Instances of earlier runs: their process is gone, or its number was taken by a process that
    // started after the instance was made.
    void removeStaleInstances(const fs::path& root) {
        const fs::path instances = root / "instances";
        std::error_code ec;
        for (const auto& entry : fs::directory_iterator(instances, ec)) {
            const std::string name = entry.path().filename().string();
            const auto owner = instanceOwner(name);
            if (!owner || *owner == ::getpid()) {
                continue;
            }
            struct stat st {};
            if (::stat(entry.path().c_str(), &st) != 0) {
                continue;
            }
            const auto started = processStartTime(*owner);
            const bool stale = !started || *started > static_cast<double>(st.st_mtime) + 1.0;
            if (!stale) {
                continue;
            }
            if (const int error = removeInstance(entry.path()); error != 0) {
                report(fmt::format("cannot remove the stale trace instance {}: {}",
                                   entry.path().string(), errnoText(error)));
            } else {
                report(fmt::format("removed the stale trace instance {}", entry.path().string()));
            }
        }
    }

    // Instances of this process that could not be removed at their stop.
    void retryLeftovers() {
        for (auto it = leftovers.begin(); it != leftovers.end();) {
            if (::rmdir(it->c_str()) == 0 || errno == ENOENT) {
                it = leftovers.erase(it);
            } else {
                ++it;
            }
        }
    }

    void leaveForLater(const fs::path& instance, int error) {
        // Nothing more is recorded there; the buffer goes back to the kernel until removal works.
        writeControl(instance / "tracing_on", "0");
        writeControl(instance / "buffer_size_kb", "1");
        leftovers.push_back(instance);
        report(fmt::format("cannot remove the trace instance {} yet: {}; it is tried again later",
                           instance.string(), errnoText(error)));
    }

    // Sets up the instance and switches tracing on; the error, or nothing on success.
    std::optional<std::string> begin(Recording& rec) {
        std::string error;
        const auto root = findRoot(error);
        if (!root) {
            return error;
        }
        if (!staleChecked.contains(root->string())) {
            staleChecked.insert(root->string());
            removeStaleInstances(*root);
        }
        retryLeftovers();
        rec.root = *root;
        // One count for the whole process: several recorders may share it (tests do).
        static std::atomic<std::uint64_t> sequence{0};
        rec.name = fmt::format("{}{}-{}", kInstancePrefix, ::getpid(), ++sequence);
        rec.instance = *root / "instances" / rec.name;
        if (::mkdir(rec.instance.c_str(), 0700) != 0) {
            const int e = errno;
            if (e == ENOENT || e == ENOTDIR) {
                return fmt::format("tracefs at {} offers no trace instances", root->string());
            }
            if (e == EACCES || e == EPERM || e == EROFS) {
                return fmt::format("no permission to create a trace instance in {}: {}",
                                   root->string(), errnoText(e));
            }
            return fmt::format("cannot create the trace instance {}: {}", rec.instance.string(),
                               errnoText(e));
        }
        const auto fail = [&](std::string text) -> std::optional<std::string> {
            if (const int e = removeInstance(rec.instance); e != 0) {
                leaveForLater(rec.instance, e);
            }
            return text;
        };
        if (const int e = writeControl(rec.instance / "buffer_size_kb",
                                       std::to_string(options.bufferKbPerCpu));
            e != 0) {
            return fail(fmt::format("cannot give the trace instance {} KiB per CPU: {}",
                                    options.bufferKbPerCpu, errnoText(e)));
        }
        // A clock shared by every CPU, so that a task's markers on two CPUs compare.
        const std::string clocks = readSmall(rec.instance / "trace_clock");
        if ((" " + clocks + " ").find(" mono ") != std::string::npos &&
            writeControl(rec.instance / "trace_clock", "mono") == 0) {
            rec.clock = "mono";
        }
        if (fs::exists(rec.instance / "options" / "copy_trace_marker")) {
            writeControl(rec.instance / "options" / "copy_trace_marker", "1");
        }
        for (const std::string& event : templateEvents(rec.configuration.templateNumber)) {
            fs::path enable = rec.instance / "events";
            const auto colon = event.find(':');
            if (colon == std::string::npos) {
                enable /= event;
            } else {
                enable = enable / event.substr(0, colon) / event.substr(colon + 1);
            }
            enable /= "enable";
            if (fs::exists(enable)) {
                writeControl(enable, "1");
            }
        }
        if (const int e = writeControl(rec.instance / "tracing_on", "1"); e != 0) {
            return fail(fmt::format("cannot switch tracing on in {}: {}", rec.instance.string(),
                                    errnoText(e)));
        }
        return std::nullopt;
    }

    // Copies the instance's trace to a file of its own; the file, or the error.
    std::optional<fs::path> copyTrace(const Recording& rec, std::string& error) {
        std::error_code ec;
        fs::create_directories(options.traceDirectory, ec);
        if (ec) {
            error =
                fmt::format("cannot create {}: {}", options.traceDirectory.string(), ec.message());
            return std::nullopt;
        }
        const int in = ::open((rec.instance / "trace").c_str(), O_RDONLY | O_CLOEXEC);
        if (in < 0) {
            error = fmt::format("cannot read the trace of {}: {}", rec.instance.string(),
                                errnoText(errno));
            return std::nullopt;
        }
        const fs::path target = options.traceDirectory / (rec.name + ".trace");
        // Written under a hidden name and renamed when whole: a reader never sees half a trace.
        const fs::path partial = options.traceDirectory / ("." + rec.name + ".trace.partial");
        const int out =
            ::open(partial.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC, 0644);
        if (out < 0) {
            error = fmt::format("cannot create {}: {}", target.string(), errnoText(errno));
            ::close(in);
            return std::nullopt;
        }
        int failure = 0;
        if (!writeAll(out, fmt::format("# qvreportd trace: instance={} template={} clock={} "
                                       "buffer_size_kb={}\n",
                                       rec.name, rec.configuration.templateNumber, rec.clock,
                                       options.bufferKbPerCpu))) {
            failure = errno;
        }
        std::string buffer(kCopyChunk, '\0');
        std::uint64_t copied = 0;
        bool cut = false;
        while (failure == 0 && !cut) {
            const ssize_t n = ::read(in, buffer.data(), buffer.size());
            if (n < 0 && errno == EINTR) {
                continue;
            }
            if (n < 0) {
                failure = errno;
                break;
            }
            if (n == 0) {
                break;
            }
            std::string_view chunk(buffer.data(), static_cast<std::size_t>(n));
            if (copied + chunk.size() > options.maxTraceBytes) {
                chunk = chunk.substr(0, static_cast<std::size_t>(options.maxTraceBytes - copied));
                // Whole lines only: the cut lands after the last complete line.
                const auto nl = chunk.rfind('\n');
                chunk = chunk.substr(0, nl == std::string_view::npos ? 0 : nl + 1);
                cut = true;
            }
            if (!writeAll(out, chunk)) {
                failure = errno;
            }
            copied += chunk.size();
        }
        if (failure == 0 && cut) {
            if (!writeAll(out, fmt::format("# qvreportd: trace cut at {} bytes\n", copied))) {
                failure = errno;
            }
            report(fmt::format("the trace of {} was cut at its cap of {} bytes", rec.name,
                               options.maxTraceBytes));
        }
        ::close(in);
        if (failure == 0 && ::fsync(out) != 0) {
            failure = errno;
        }
        if (::close(out) != 0 && failure == 0) {
            failure = errno;
        }
        if (failure == 0 && ::rename(partial.c_str(), target.c_str()) != 0) {
            failure = errno;
        }
        if (failure != 0) {
            error = fmt::format("cannot copy the trace of {} to {}: {}", rec.instance.string(),
                                target.string(), errnoText(failure));
            fs::remove(partial, ec);
            return std::nullopt;
        }
        return target;
    }

    // Keeps the newest maxTraceFiles traces.
    void pruneTraces() {
        std::vector<std::pair<fs::file_time_type, fs::path>> traces;
        std::error_code ec;
        for (const auto& entry : fs::directory_iterator(options.traceDirectory, ec)) {
            const std::string name = entry.path().filename().string();
            if (name.starts_with(kInstancePrefix) && name.ends_with(".trace")) {
                traces.emplace_back(entry.last_write_time(ec), entry.path());
            }
        }
        if (traces.size() <= options.maxTraceFiles) {
            return;
        }
        std::sort(traces.begin(), traces.end());
        for (std::size_t i = 0; i + options.maxTraceFiles < traces.size(); ++i) {
            if (!fs::remove(traces[i].second, ec) && ec) {
                report(fmt::format("cannot remove the old trace {}: {}", traces[i].second.string(),
                                   ec.message()));
            }
        }
    }

    void start(const std::shared_ptr<Recording>& rec) {
        const auto error = begin(*rec);
        if (error) {
            rec->setState(Recording::State::Failed);
            if (auto delegate = rec->currentDelegate()) {
                delegate->spanTraceDidStart(error);
            }
            // Nothing will be recorded: the recording ends here, so no one waits for it.
            if (auto delegate = rec->currentDelegate()) {
                delegate->spanTraceDidComplete(std::nullopt, rec->name,
                                               "no trace was recorded: " + *error);
            }
            return;
        }
        {
            std::lock_guard lock(mutex);
            live.push_back(rec);
        }
        {
            std::lock_guard lock(rec->mutex);
            // A stop asked for while starting is already queued behind this task.
            if (rec->state == Recording::State::Starting) {
                rec->state = Recording::State::Running;
            }
        }
        if (auto delegate = rec->currentDelegate()) {
            delegate->spanTraceDidStart(std::nullopt);
        }
    }

    void stop(const std::shared_ptr<Recording>& rec, bool quietly) {
        if (rec->instance.empty() || !forget(rec)) {
            return;  // never started, failed, or already ended
        }
        std::optional<std::string> stopError;
        if (const int e = writeControl(rec->instance / "tracing_on", "0"); e != 0) {
            stopError = fmt::format("cannot switch tracing off in {}: {}", rec->instance.string(),
                                    errnoText(e));
        }
        if (!quietly) {
            if (auto delegate = rec->currentDelegate()) {
                delegate->spanTraceDidStop(stopError);
            }
        }
        std::string copyError;
        std::optional<fs::path> trace;
        if (!quietly) {
            trace = copyTrace(*rec, copyError);
        }
        if (const int e = removeInstance(rec->instance); e != 0) {
            leaveForLater(rec->instance, e);
        }
        rec->setState(Recording::State::Done);
        if (quietly) {
            return;
        }
        pruneTraces();
        if (auto delegate = rec->currentDelegate()) {
            delegate->spanTraceDidComplete(trace, rec->name,
                                           trace ? std::nullopt : std::optional(copyError));
        }
    }

    // Takes rec off the live list; false when it was not there.
    bool forget(const std::shared_ptr<Recording>& rec) {
        std::lock_guard lock(mutex);
        const auto it = std::find(live.begin(), live.end(), rec);
        if (it == live.end()) {
            return false;
        }
        live.erase(it);
        return true;
    }

    void shutDown() {
        std::vector<std::shared_ptr<Recording>> remaining;
        {
            std::lock_guard lock(mutex);
            remaining = live;
        }
        for (const auto& rec : remaining) {
            stop(rec, /*quietly=*/true);
        }
        retryLeftovers();
        for (const auto& instance : leftovers) {
            report(fmt::format("the trace instance {} is left behind: a program holds it open",
                               instance.string()));
        }
    }

    const Options options;
    const std::function<void(const std::string&)> problem;
    std::mutex mutex;
    std::condition_variable wake;
    std::condition_variable idle;
    std::deque<std::function<void()>> tasks;       // guarded by mutex
    std::uint64_t done = 0;                        // guarded by mutex
    std::uint64_t running = 0;                     // guarded by mutex
    bool stopping = false;                         // guarded by mutex
    std::vector<std::shared_ptr<Recording>> live;  // guarded by mutex
    // The recorder's thread only:
    std::set<std::string> staleChecked;
    std::vector<fs::path> leftovers;
    std::thread thread;  // last: starts once the members above exist
};

namespace {

class LinuxSpanTraceSession final : public SpanTraceSession {
  public:
    LinuxSpanTraceSession(std::shared_ptr<LinuxSpanTraceRecorder::Core> core,
                          const SpanTraceConfiguration& configuration)
        : core_(std::move(core)), rec_(std::make_shared<Recording>()) {
        rec_->configuration = configuration;
    }
    // A recording that was never stopped is switched off and its instance removed.
    ~LinuxSpanTraceSession() override {
        core_->post([core = core_.get(), rec = rec_] { core->stop(rec, /*quietly=*/true); });
    }

    void setDelegate(std::weak_ptr<SpanTraceDelegate> delegate) override {
        std::lock_guard lock(rec_->mutex);
        rec_->delegate = std::move(delegate);
    }

    void start() override {
        {
            std::lock_guard lock(rec_->mutex);
            if (rec_->state != Recording::State::Created) {
                return;
            }
            rec_->state = Recording::State::Starting;
        }
        core_->post([core = core_.get(), rec = rec_] { core->start(rec); });
    }

    void stop() override {
        {
            std::lock_guard lock(rec_->mutex);
            if (rec_->state != Recording::State::Starting &&
                rec_->state != Recording::State::Running) {
                return;
            }
            rec_->state = Recording::State::Stopping;
        }
        core_->post([core = core_.get(), rec = rec_] { core->stop(rec, /*quietly=*/false); });
    }

    bool isValid() const override {
        std::lock_guard lock(rec_->mutex);
        return rec_->state == Recording::State::Starting ||
               rec_->state == Recording::State::Running;
    }

  private:
    const std::shared_ptr<LinuxSpanTraceRecorder::Core> core_;
    const std::shared_ptr<Recording> rec_;
};

}  // namespace

LinuxSpanTraceRecorder::LinuxSpanTraceRecorder(Options options,
                                               std::function<void(const std::string&)> problem)
    : core_(std::make_shared<Core>(std::move(options), std::move(problem))) {}

LinuxSpanTraceRecorder::~LinuxSpanTraceRecorder() {
    core_->shutDownAndJoin();
}

std::shared_ptr<SpanTraceConfiguration> LinuxSpanTraceRecorder::configurationFromTemplate(
    int templateNumber) {
    if (templateNumber != 2 && templateNumber != 3) {
        return nullptr;
    }
    auto configuration = std::make_shared<SpanTraceConfiguration>();
    configuration->templateNumber = templateNumber;
    return configuration;
}

std::shared_ptr<SpanTraceSession> LinuxSpanTraceRecorder::createSession(
    const SpanTraceConfiguration& configuration) {
    return std::make_shared<LinuxSpanTraceSession>(core_, configuration);
}

std::vector<std::string> LinuxSpanTraceRecorder::templateEvents(int templateNumber) {
    std::vector<std::string> events{
        "sched:sched_switch",       "sched:sched_waking",       "sched:sched_wakeup",
        "sched:sched_wakeup_new",   "sched:sched_migrate_task", "sched:sched_process_fork",
        "sched:sched_process_exec", "sched:sched_process_exit",
    };
    if (templateNumber == 3) {
        for (const char* event :
             {"irq:irq_handler_entry", "irq:irq_handler_exit", "irq:softirq_raise",
              "irq:softirq_entry", "irq:softirq_exit", "asoc", "snd_pcm", "hda", "hda_controller",
              "hda_intel", "sof", "sof_intel"}) {
            events.emplace_back(event);
        }
    }
    return events;
}

void LinuxSpanTraceRecorder::drain() {
    core_->drain();
}

}  // namespace qv

#include "platform/linux/capture/LinuxIssueCaptureService.h"

#include <fmt/format.h>

#include <algorithm>
#include <cmath>
#include <ctime>
#include <filesystem>
#include <fstream>

#include <nlohmann/json.hpp>

#include "platform/Clock.h"
#include "platform/PreferenceStore.h"
#include "platform/linux/capture/IssueCaptureCollector.h"
#include "values/ValueJson.h"

namespace qv {

namespace {

// Manifests of earlier runs read at start, at most; older ones beyond do not matter for a day.
constexpr std::size_t kMaxEarlierCapturesScanned = 10000;
// The thread looks at its deadlines at least this often, so a clock that is moved (in tests) or
// that drifts from the condition variable's is noticed.
constexpr auto kLongestSleep = std::chrono::seconds(1);

const std::string* stringPart(const Dictionary& signature, std::string_view key) {
    const Value* v = signature.find(key);
    return v ? v->asString() : nullptr;
}

// The parts that make two signatures the same kind of issue.
std::string signatureKey(const Dictionary& signature) {
    std::string key;
    for (const std::string_view part :
         {kIssueCaptureSignatureDomain, kIssueCaptureSignatureType, kIssueCaptureSignatureSubtype,
          kIssueCaptureSignatureSubtypeContext, kIssueCaptureSignatureDetectedProcess}) {
        if (const std::string* text = stringPart(signature, part)) {
            key += *text;
        }
        key.push_back('\x1f');
    }
    return key;
}

// The same parts as a number, for the door, which must not allocate for every request it sees.
std::uint64_t doorKey(const Dictionary& signature) {
    std::uint64_t h = 1469598103934665603ull;
    for (const std::string_view part :
         {kIssueCaptureSignatureDomain, kIssueCaptureSignatureType, kIssueCaptureSignatureSubtype,
          kIssueCaptureSignatureSubtypeContext, kIssueCaptureSignatureDetectedProcess}) {
        const std::string* text = stringPart(signature, part);
        const std::uint64_t p = std::hash<std::string_view>{}(text ? *text : std::string_view());
        h = (h ^ p) * 1099511628211ull + 0x9e3779b97f4a7c15ull;
    }
    return h;
}

bool validSignature(const Dictionary& signature) {
    for (const std::string_view part :
         {kIssueCaptureSignatureDomain, kIssueCaptureSignatureType, kIssueCaptureSignatureSubtype,
          kIssueCaptureSignatureSubtypeContext, kIssueCaptureSignatureDetectedProcess}) {
        if (!stringPart(signature, part)) {
            return false;
        }
    }
    return true;
}

// The service refuses only with codes it defines.
std::string_view errorName(std::int64_t reason) {
    return IssueCaptureErrorName(reason).value_or("unknown");
}

Dictionary failure(std::int64_t reason) {
    return Dictionary{{std::string(kIssueCaptureReplySuccess), false},
                      {std::string(kIssueCaptureReplyReason), reason}};
}

// The answers given at the door, made once: a flood meets them many times.
const Dictionary& refusal(std::int64_t reason) {
    static const Dictionary unavailable = failure(kIssueCaptureErrorServiceUnavailable);
    static const Dictionary throttled = failure(kIssueCaptureErrorRequestThrottled);
    return reason == kIssueCaptureErrorRequestThrottled ? throttled : unavailable;
}

}  // namespace

// The settings of the suite at one moment; a value of the wrong kind or out of range is ignored.
struct LinuxIssueCaptureService::Policy {
    bool enabled = true;
    std::int64_t dailyLimit = kDefaultDailyLimit;
    double signatureInterval = kDefaultSignatureIntervalSeconds;
    double journalWindow = kDefaultJournalWindowSeconds;
    std::int64_t maxJournalLines = kDefaultMaxJournalLines;
    std::int64_t maxCaptureBytes = kDefaultMaxCaptureBytes;

    static Policy read(const PreferenceStore& preferences) {
        Policy p;
        const Dictionary suite = preferences.values(kSuite);  // one look at the store
        const auto number = [&](std::string_view key) -> std::optional<double> {
            const Value* v = suite.find(key);
            if (!v || v->kind() == Value::Kind::Bool) {
                return std::nullopt;
            }
            const auto d = v->asDouble();
            if (!d || !std::isfinite(*d) || *d < 0) {
                return std::nullopt;
            }
            return d;
        };
        if (const Value* v = suite.find(kEnabledKey); v && v->kind() == Value::Kind::Bool) {
            p.enabled = v->boolValue();
        }
        if (const auto d = number(kDailyLimitKey)) {
            p.dailyLimit = static_cast<std::int64_t>(std::min(*d, 1e9));
        }
        if (const auto d = number(kSignatureIntervalKey)) {
            p.signatureInterval = *d;
        }
        if (const auto d = number(kJournalWindowKey)) {
            p.journalWindow = std::min(*d, kDaySeconds * 30);
        }
        if (const auto d = number(kMaxJournalLinesKey)) {
            p.maxJournalLines = static_cast<std::int64_t>(std::min(*d, 1e7));
        }
        if (const auto d = number(kMaxCaptureBytesKey)) {
            p.maxCaptureBytes = static_cast<std::int64_t>(std::min(*d, 1e9));
        }
        return p;
    }
};

class LinuxIssueCaptureService::Reporter final : public IssueCaptureReporter {
  public:
    explicit Reporter(LinuxIssueCaptureService& service) : service_(service) {}

    Dictionary makeSignature(std::string_view domain, std::string_view type,
                             std::string_view subtype, std::string_view subtypeContext,
                             std::string_view detectedProcess,
                             const std::optional<Dictionary>& thresholdValues) override {
        Dictionary signature;
        signature.reserve(6);
        signature.set(kIssueCaptureSignatureDomain, domain);
        signature.set(kIssueCaptureSignatureType, type);
        signature.set(kIssueCaptureSignatureSubtype, subtype);
        signature.set(kIssueCaptureSignatureSubtypeContext, subtypeContext);
        signature.set(kIssueCaptureSignatureDetectedProcess, detectedProcess);
        if (thresholdValues) {
            signature.set(kIssueCaptureSignatureThresholdValues, *thresholdValues);
        }
        return signature;
    }

    bool snapshotWithSignature(const Dictionary& signature, double duration,
                               const std::optional<Dictionary>& /*event*/,
                               const std::optional<Dictionary>& payload,
                               ReplyCallback reply) override {
        return service_.request("snapshot", signature, duration, payload, std::move(reply));
    }

    bool startSessionWithSignature(const Dictionary& signature, double duration,
                                   const std::optional<Array>& /*events*/,
                                   const std::optional<Dictionary>& payload,
                                   const std::optional<Array>& /*actions*/,
                                   ReplyCallback reply) override {
        return service_.request("session", signature, duration, payload, std::move(reply));
    }

    void cancelSession(const std::string& sessionIdentifier) override {
        service_.cancel(sessionIdentifier);
    }

  private:
    LinuxIssueCaptureService& service_;
};

LinuxIssueCaptureService::LinuxIssueCaptureService(const Clock& clock,
                                                   const PreferenceStore& preferences,
                                                   std::unique_ptr<JsonlSink> sink, Options options,
                                                   Callbacks callbacks)
    : clock_(clock),
      preferences_(preferences),
      sink_(std::move(sink)),
      options_(std::move(options)),
      callbacks_(std::move(callbacks)),
      thread_([this] { run(); }) {}

LinuxIssueCaptureService::~LinuxIssueCaptureService() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    wake_.notify_all();
    thread_.join();
    for (const auto& [id, session] : pending_) {
        Dictionary line{{"op", "cancel"}, {"sessionID", id}, {"why", "the daemon stopped"}};
        sink_->append(std::move(line));
    }
}

std::shared_ptr<IssueCaptureReporter> LinuxIssueCaptureService::createReporter() {
    return std::make_shared<Reporter>(*this);
}

void LinuxIssueCaptureService::flush() {
    std::uint64_t target = 0;
    {
        std::lock_guard lock(mutex_);
        tasks_.push_back([] {});
        queued_.store(tasks_.size(), std::memory_order_relaxed);
        target = ++tasksQueued_;
    }
    wake_.notify_one();
    {
        std::unique_lock lock(mutex_);
        done_.wait(lock, [&] { return tasksDone_ >= target; });
    }
    sink_->flush();
}

bool LinuxIssueCaptureService::enqueue(std::function<void()> task) {
    bool wasEmpty = false;
    {
        std::lock_guard lock(mutex_);
        if (tasks_.size() >= kMaxQueuedRequests) {
            return false;
        }
        wasEmpty = tasks_.empty();
        tasks_.push_back(std::move(task));
        queued_.store(tasks_.size(), std::memory_order_relaxed);
        ++tasksQueued_;
    }
    // The thread sleeps only on an empty queue and drains it whole once awake: a flood of
    // requests wakes it once, not once per request.
    if (wasEmpty) {
        wake_.notify_one();
    }
    return true;
}

void LinuxIssueCaptureService::refuseNow(std::int64_t reason, const ReplyCallback& reply) {
    // No sink line: a flood that fills the queue would only fill the sink's buffer next. The
    // refusal is counted, and the caller hears of it.
    if (callbacks_.refused) {
        callbacks_.refused(errorName(reason));
    }
    if (reply) {
        reply(reason == kIssueCaptureErrorServiceUnavailable ||
                      reason == kIssueCaptureErrorRequestThrottled
                  ? refusal(reason)
                  : failure(reason));
    }
}

bool LinuxIssueCaptureService::request(std::string_view kind, const Dictionary& signature,
                                       double duration, const std::optional<Dictionary>& payload,
                                       ReplyCallback reply) {
    if (!validSignature(signature) || !std::isfinite(duration) || duration < 0 ||
        duration > kMaxDurationSeconds) {
        return false;
    }
    // A full queue is refused before anything is copied for it.
    if (queued_.load(std::memory_order_relaxed) >= kMaxQueuedRequests) {
        refuseNow(kIssueCaptureErrorServiceUnavailable, reply);
        return true;
    }
    const double requested = clock_.now();
    if (throttledAtTheDoor(doorKey(signature), requested)) {
        refuseNow(kIssueCaptureErrorRequestThrottled, reply);
        return true;
    }
    auto shared = std::make_shared<ReplyCallback>(std::move(reply));
    const bool queued =
        enqueue([this, k = std::string(kind), signature, duration, payload, requested, shared] {
            handleRequest(k, signature, duration, payload, requested, *shared);
        });
    if (!queued) {
        refuseNow(kIssueCaptureErrorServiceUnavailable, *shared);
    }
    return true;
}

bool LinuxIssueCaptureService::throttledAtTheDoor(std::uint64_t key, double now) const {
    std::lock_guard lock(doorMutex_);
    const auto it = throttledUntil_.find(key);
    return it != throttledUntil_.end() && now < it->second;
}

void LinuxIssueCaptureService::publishThrottle(const Dictionary& signature, double until,
                                               double now) {
    const std::uint64_t key = doorKey(signature);
    std::lock_guard lock(doorMutex_);
    if (throttledUntil_.size() >= kMaxTrackedSignatures && !throttledUntil_.contains(key)) {
        std::erase_if(throttledUntil_, [&](const auto& entry) { return entry.second <= now; });
        if (throttledUntil_.size() >= kMaxTrackedSignatures) {
            throttledUntil_.clear();  // the thread's own rule still holds
        }
    }
    throttledUntil_[key] = until;
}

void LinuxIssueCaptureService::cancel(const std::string& identifier) {
    if (!enqueue([this, identifier] { handleCancel(identifier); })) {
        refuseNow(kIssueCaptureErrorServiceUnavailable, nullptr);
    }
}

void LinuxIssueCaptureService::run() {
    countEarlierCaptures();
    std::unique_lock lock(mutex_);
    std::deque<std::function<void()>> batch;
    for (;;) {
        lock.unlock();
        collectDue();
        lock.lock();
        if (!tasks_.empty()) {
            // Everything waiting is taken at once: one lock per batch, not one per request.
            batch.swap(tasks_);
            queued_.store(0, std::memory_order_relaxed);
            lock.unlock();
            const std::size_t n = batch.size();
            for (auto& task : batch) {
                task();
                task = nullptr;  // what it holds goes before a flush that waits on it
            }
            batch.clear();
            lock.lock();
            tasksDone_ += n;
            done_.notify_all();
            continue;
        }
        if (stopping_) {
            return;
        }
        if (const auto wait = timeToNextDeadline()) {
            wake_.wait_for(lock,
                           std::min<std::chrono::steady_clock::duration>(*wait, kLongestSleep));
        } else {
            wake_.wait(lock);
        }
    }
}

std::optional<std::chrono::steady_clock::duration> LinuxIssueCaptureService::timeToNextDeadline()
    const {
    if (pending_.empty()) {
        return std::nullopt;
    }
    auto next = pending_.begin()->second.deadline;
    for (const auto& [id, session] : pending_) {
        next = std::min(next, session.deadline);
    }
    return std::max<std::chrono::steady_clock::duration>(next - clock_.steadyNow(),
                                                         std::chrono::steady_clock::duration{0});
}

std::optional<std::int64_t> LinuxIssueCaptureService::policyRefusal(const Policy& policy,
                                                                    const std::string& key,
                                                                    double now) {
    if (!policy.enabled) {
        return kIssueCaptureErrorNotSupported;
    }
    while (!acceptedToday_.empty() && now - acceptedToday_.front().first >= kDaySeconds) {
        acceptedToday_.pop_front();
    }
    if (static_cast<std::int64_t>(acceptedToday_.size()) >= policy.dailyLimit) {
        return kIssueCaptureErrorDailyLimitExceeded;
    }
    if (const auto it = lastBySignature_.find(key); it != lastBySignature_.end()) {
        // A clock that went back makes the difference negative: still too soon.
        if (now - it->second < policy.signatureInterval) {
            return kIssueCaptureErrorRequestThrottled;
        }
    }
    return std::nullopt;
}

void LinuxIssueCaptureService::handleRequest(const std::string& kind, const Dictionary& signature,
                                             double duration,
                                             const std::optional<Dictionary>& payload,
                                             double requested, const ReplyCallback& reply) {
    const Policy policy = Policy::read(preferences_);
    const double now = clock_.now();
    const std::string key = signatureKey(signature);
    auto refusal = policyRefusal(policy, key, now);
    if (!refusal && kind == "session" && pending_.size() >= kMaxPendingSessions) {
        refusal = kIssueCaptureErrorServiceUnavailable;
    }
    Dictionary line{{"op", kind}, {"signature", signature}, {"duration", duration}};
    if (payload) {
        line.set("payload", *payload);
    }
    if (refusal) {
        if (*refusal == kIssueCaptureErrorRequestThrottled) {
            publishThrottle(signature, lastBySignature_[key] + policy.signatureInterval, now);
        }
        sink_->append(std::move(line));
        if (callbacks_.refused) {
            callbacks_.refused(errorName(*refusal));
        }
        answer(kind, std::nullopt, failure(*refusal), reply);
        return;
    }
    const std::string id = newIdentifier(now);
    line.set("sessionID", id);
    sink_->append(std::move(line));
    acceptedToday_.emplace_back(now, id);
    if (lastBySignature_.size() >= kMaxTrackedSignatures) {
        std::erase_if(lastBySignature_, [&](const auto& entry) {
            return now - entry.second >= policy.signatureInterval;
        });
        if (lastBySignature_.size() >= kMaxTrackedSignatures) {
            lastBySignature_.clear();  // the daily limit still bounds the captures
        }
    }
    lastBySignature_[key] = now;
    publishThrottle(signature, now + policy.signatureInterval, now);
    answer(kind, id,
           Dictionary{{std::string(kIssueCaptureReplySuccess), true},
                      {std::string(kIssueCaptureReplySessionID), id}},
           reply);

    PendingSession capture{signature, payload, duration, requested, {}};
    if (kind == "snapshot") {
        collect(id, kind, capture);
        return;
    }
    capture.deadline =
        clock_.steadyNow() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                 std::chrono::duration<double>(duration));
    pending_.emplace(id, std::move(capture));
    pendingCount_.store(pending_.size());
}

void LinuxIssueCaptureService::handleCancel(const std::string& identifier) {
    sink_->append(Dictionary{{"op", "cancel"}, {"sessionID", identifier}});
    const auto it = pending_.find(identifier);
    if (it == pending_.end()) {
        if (callbacks_.refused) {
            callbacks_.refused(errorName(kIssueCaptureErrorSessionNotFound));
        }
        answer("cancel", identifier, failure(kIssueCaptureErrorSessionNotFound), nullptr);
        return;
    }
    pending_.erase(it);
    pendingCount_.store(pending_.size());
    // Nothing was collected: the place in the day's count is given back.
    std::erase_if(acceptedToday_, [&](const auto& entry) { return entry.second == identifier; });
    answer("cancel", identifier,
           Dictionary{{std::string(kIssueCaptureReplySuccess), true},
                      {std::string(kIssueCaptureReplySessionID), identifier}},
           nullptr);
}

void LinuxIssueCaptureService::collectDue() {
    if (pending_.empty()) {
        return;
    }
    const auto now = clock_.steadyNow();
    for (auto it = pending_.begin(); it != pending_.end();) {
        if (it->second.deadline > now) {
            ++it;
            continue;
        }
        const std::string id = it->first;
        const PendingSession capture = std::move(it->second);
        it = pending_.erase(it);
        pendingCount_.store(pending_.size());
        collect(id, "session", capture);
    }
}

void LinuxIssueCaptureService::collect(const std::string& id, const std::string& kind,
                                       const PendingSession& capture) {
    const Policy policy = Policy::read(preferences_);
    IssueCaptureJob job;
    job.id = id;
    job.kind = kind;
    job.signature = capture.signature;
    job.payload = capture.payload;
    job.duration = capture.duration;
    job.requested = capture.requested;
    job.windowFrom = capture.requested - policy.journalWindow;
    job.windowTo = clock_.now();
    job.directory = std::filesystem::path(options_.capturesDirectory) / id;
    job.journalDirectory = options_.journalDirectory;
    job.daemonPid = options_.daemonPid;
    job.maxJournalLines = static_cast<std::size_t>(policy.maxJournalLines);
    job.maxBytes = static_cast<std::size_t>(policy.maxCaptureBytes);
    const IssueCaptureOutcome outcome = QVReportingCollectIssueCapture(job, clock_.now());
    if (callbacks_.problem) {
        for (const std::string& problem : outcome.problems) {
            callbacks_.problem(problem);
        }
    }
}

void LinuxIssueCaptureService::answer(std::string_view request,
                                      const std::optional<std::string>& id, const Dictionary& reply,
                                      const ReplyCallback& callback) {
    Dictionary line{{"op", "reply"}, {"request", request}};
    if (id) {
        line.set("sessionID", *id);
    }
    line.set("reply", reply);
    sink_->append(std::move(line));
    if (callback) {
        callback(reply);
    }
}

std::string LinuxIssueCaptureService::newIdentifier(double now) {
    const auto seconds = static_cast<std::time_t>(std::isfinite(now) ? std::floor(now) : 0);
    std::tm tm{};
    gmtime_r(&seconds, &tm);
    const std::string stamp =
        fmt::format("{:04}{:02}{:02}T{:02}{:02}{:02}Z", tm.tm_year + 1900, tm.tm_mon + 1,
                    tm.tm_mday, tm.tm_hour, tm.tm_min, tm.tm_sec);
    for (;;) {
        std::string id = fmt::format("{}-{}-{}", stamp, options_.daemonPid, nextNumber_++);
        std::error_code ec;
        if (!std::filesystem::exists(std::filesystem::path(options_.capturesDirectory) / id, ec)) {
            return id;
        }
    }
}

void LinuxIssueCaptureService::countEarlierCaptures() {
    std::error_code ec;
    std::filesystem::directory_iterator it(options_.capturesDirectory, ec);
    if (ec) {
        return;  // no captures yet
    }
    const double now = clock_.now();
    const double interval = Policy::read(preferences_).signatureInterval;
    std::vector<std::pair<double, std::string>> found;
    std::size_t scanned = 0;
    for (; it != std::filesystem::directory_iterator() && scanned < kMaxEarlierCapturesScanned;
         it.increment(ec), ++scanned) {
        if (ec) {
            break;
        }
        std::ifstream in(it->path() / "manifest.json");
        if (!in) {
            continue;
        }
        const auto manifest = nlohmann::json::parse(in, nullptr, /*allow_exceptions=*/false);
        if (!manifest.is_object()) {
            continue;
        }
        const auto requested = manifest.find("requested");
        if (requested == manifest.end() || !requested->is_number()) {
            continue;
        }
        const double t = requested->get<double>();
        if (now - t < 0 || now - t >= kDaySeconds) {
            continue;
        }
        found.emplace_back(t, it->path().filename().string());
        if (const auto sig = manifest.find("signature");
            sig != manifest.end() && sig->is_object()) {
            const Dictionary signature = QVReportingDictionaryFromJson(*sig);
            auto& last = lastBySignature_[signatureKey(signature)];
            last = std::max(last, t);
            publishThrottle(signature, last + interval, now);
        }
    }
    std::sort(found.begin(), found.end());
    acceptedToday_.assign(found.begin(), found.end());
}

}  // namespace qv

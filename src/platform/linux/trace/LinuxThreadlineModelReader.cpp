#include "platform/linux/trace/LinuxThreadlineModelReader.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstring>
#include <string>
#include <system_error>
#include <unordered_map>
#include <vector>

#include <fmt/format.h>

namespace qv {

namespace {

constexpr std::string_view kMarkerEvent = "tracing_mark_write: ";
constexpr std::string_view kEntriesHeader = "entries-in-buffer/entries-written:";
constexpr std::string_view kLostPrefix = "[LOST ";
// The recorder's note that it stopped copying at its size cap.
constexpr std::string_view kCutNote = "# qvreportd: trace cut";
constexpr std::size_t kReadChunk = 1024 * 1024;

std::string_view trim(std::string_view s) {
    const auto blank = [](char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; };
    while (!s.empty() && blank(s.front())) {
        s.remove_prefix(1);
    }
    while (!s.empty() && blank(s.back())) {
        s.remove_suffix(1);
    }
    return s;
}

template <typename T>
bool parseNumber(std::string_view s, T& out) {
    if (s.empty()) {
        return false;
    }
    const auto [end, ec] = std::from_chars(s.data(), s.data() + s.size(), out);
    return ec == std::errc() && end == s.data() + s.size();
}

// "1944.015314" in nanoseconds; a stamp without a fraction is taken as a count of nanoseconds.
bool parseTimestamp(std::string_view s, std::int64_t& ns) {
    const auto dot = s.find('.');
    std::int64_t whole = 0;
    if (dot == std::string_view::npos) {
        return parseNumber(s, ns);
    }
    if (!parseNumber(s.substr(0, dot), whole) || whole < 0 || whole > 9'000'000'000) {
        return false;
    }
    std::string_view fraction = s.substr(dot + 1);
    if (fraction.empty() || fraction.size() > 9) {
        return false;
    }
    std::int64_t digits = 0;
    if (!parseNumber(fraction, digits)) {
        return false;
    }
    for (std::size_t i = fraction.size(); i < 9; ++i) {
        digits *= 10;
    }
    ns = whole * 1'000'000'000 + digits;
    return true;
}

// The task and time of a marker line's head: "<comm>-<pid> [<cpu>] <flags> <stamp>: ". The task
// name may hold blanks, dashes and brackets; what follows it does not, so the head is read from
// the right.
bool parseHead(std::string_view head, std::int32_t& pid, std::int64_t& ns) {
    head = trim(head);
    if (head.empty() || head.back() != ':') {
        return false;
    }
    head.remove_suffix(1);
    const auto stampAt = head.rfind(' ');
    if (stampAt == std::string_view::npos || !parseTimestamp(head.substr(stampAt + 1), ns)) {
        return false;
    }
    head = head.substr(0, stampAt);
    const auto cpuAt = head.rfind('[');
    if (cpuAt == std::string_view::npos) {
        return false;
    }
    std::string_view task = trim(head.substr(0, cpuAt));
    if (!task.empty() && task.back() == ')') {  // "(tgid)" when the trace records it
        const auto open = task.rfind('(');
        if (open == std::string_view::npos) {
            return false;
        }
        task = trim(task.substr(0, open));
    }
    const auto dash = task.rfind('-');
    return dash != std::string_view::npos && parseNumber(task.substr(dash + 1), pid);
}

struct StringHash {
    using is_transparent = void;
    std::size_t operator()(std::string_view s) const { return std::hash<std::string_view>{}(s); }
};

struct Marker {
    std::uint32_t text;
    std::int32_t pid;
    std::int64_t ns;
};

class LinuxThreadlineModel final : public ThreadlineModel {
  public:
    void addLine(std::string_view line);
    void noteUnread() { cut_ = true; }

    std::vector<ThreadlineProbe> probesFromDictionaries(
        const std::vector<Dictionary>& dictionaries,
        std::vector<std::string>* problems) const override;
    double secondsFromTimebase(std::uint64_t duration) const override {
        return static_cast<double>(duration) * 1e-9;
    }
    std::string summary() const override {
        return fmt::format(
            "lines={} markers={} distinctMarkers={} unreadableMarkerLines={} "
            "eventsLostByKernel={} cut={}",
            lines_, markers_.size(), texts_.size(), malformed_, lost_, cut_ ? "YES" : "NO");
    }

  private:
    // A probe as its dictionary describes it, with the counts that pairing finds.
    struct ProbePlan {
        std::string name;
        std::string begin;
        std::string end;
        std::vector<ProbePlan> children;
        std::vector<ThreadlineEvent> events;
        std::uint64_t unpairedBegins = 0;
        std::uint64_t unmatchedEnds = 0;
    };

    static bool buildPlan(const Dictionary& dictionary, const std::string& where, int depth,
                          ProbePlan& plan, std::vector<std::string>* problems);
    static void collectLeaves(ProbePlan& plan, std::vector<ProbePlan*>& leaves);
    static ThreadlineProbe toProbe(ProbePlan&& plan);
    void pair(const std::vector<ProbePlan*>& leaves) const;

    std::unordered_map<std::string, std::uint32_t, StringHash, std::equal_to<>> texts_;
    std::vector<Marker> markers_;
    std::uint64_t lines_ = 0;
    std::uint64_t malformed_ = 0;
    std::uint64_t lost_ = 0;
    bool cut_ = false;
};

void LinuxThreadlineModel::addLine(std::string_view line) {
    ++lines_;
    if (line.empty()) {
        return;
    }
    if (line.front() == '#') {
        if (line.starts_with(kCutNote)) {
            cut_ = true;
        } else if (const auto at = line.find(kEntriesHeader); at != std::string_view::npos) {
            // "# entries-in-buffer/entries-written: 75/80   #P:2": what the ring buffer overwrote.
            std::string_view counts = trim(line.substr(at + kEntriesHeader.size()));
            counts = counts.substr(0, counts.find(' '));
            const auto slash = counts.find('/');
            std::uint64_t kept = 0;
            std::uint64_t written = 0;
            if (slash != std::string_view::npos && parseNumber(counts.substr(0, slash), kept) &&
                parseNumber(counts.substr(slash + 1), written) && written > kept) {
                lost_ += written - kept;
            }
        }
        return;
    }
    const auto at = line.find(kMarkerEvent);
    if (at == std::string_view::npos) {
        // "CPU:1 [LOST 12 EVENTS]"
        if (const auto lostAt = line.find(kLostPrefix); lostAt != std::string_view::npos) {
            std::string_view n = line.substr(lostAt + kLostPrefix.size());
            n = n.substr(0, n.find(' '));
            std::uint64_t count = 0;
            if (parseNumber(n, count)) {
                lost_ += count;
            }
        }
        return;
    }
    Marker marker{};
    if (!parseHead(line.substr(0, at), marker.pid, marker.ns)) {
        ++malformed_;
        return;
    }
    const std::string_view text = trim(line.substr(at + kMarkerEvent.size()));
    auto found = texts_.find(text);
    if (found == texts_.end()) {
        found = texts_.emplace(std::string(text), static_cast<std::uint32_t>(texts_.size())).first;
    }
    marker.text = found->second;
    markers_.push_back(marker);
}

bool LinuxThreadlineModel::buildPlan(const Dictionary& dictionary, const std::string& where,
                                     int depth, ProbePlan& plan,
                                     std::vector<std::string>* problems) {
    const auto refuse = [&](std::string_view why) {
        if (problems) {
            problems->push_back(fmt::format("{}: {}", where, why));
        }
        return false;
    };
    // Property lists reach here already bounded in depth; this keeps the recursion bounded for
    // any caller.
    if (depth > 32) {
        return refuse("probes nested more than 32 deep");
    }
    const Value* name = dictionary.find(threadline::kProbeName);
    if (!name || !name->isString() || name->asString()->empty()) {
        return refuse("no \"Name\" string");
    }
    plan.name = *name->asString();
    const Value* children = dictionary.find(threadline::kProbeChildren);
    if (children && !children->isArray()) {
        return refuse(fmt::format("\"{}\": \"Children\" is not an array", plan.name));
    }
    if (children && !children->asArray()->empty()) {
        std::size_t index = 0;
        for (const Value& child : *children->asArray()) {
            const std::string childWhere =
                fmt::format("{} \"{}\" child {}", where, plan.name, index++);
            if (!child.isDictionary()) {
                if (problems) {
                    problems->push_back(childWhere + ": not a dictionary");
                }
                continue;
            }
            ProbePlan built;
            if (buildPlan(*child.asDictionary(), childWhere, depth + 1, built, problems)) {
                plan.children.push_back(std::move(built));
            }
        }
        if (plan.children.empty()) {
            return refuse(fmt::format("\"{}\": no valid child", plan.name));
        }
        return true;
    }
    // No children (or an empty list): the probe is measured by its own markers.
    const Value* begin = dictionary.find(threadline::kProbeBeginMarker);
    const Value* end = dictionary.find(threadline::kProbeEndMarker);
    if (begin && begin->isString()) {
        plan.begin = trim(*begin->asString());
    }
    if (end && end->isString()) {
        plan.end = trim(*end->asString());
    }
    if (plan.begin.empty() || plan.end.empty()) {
        return refuse(
            fmt::format("\"{}\": needs \"BeginMarker\" and \"EndMarker\" strings", plan.name));
    }
    if (plan.begin == plan.end) {
        return refuse(
            fmt::format("\"{}\": \"BeginMarker\" and \"EndMarker\" are the same text", plan.name));
    }
    return true;
}

void LinuxThreadlineModel::collectLeaves(ProbePlan& plan, std::vector<ProbePlan*>& leaves) {
    if (plan.children.empty()) {
        leaves.push_back(&plan);
        return;
    }
    for (auto& child : plan.children) {
        collectLeaves(child, leaves);
    }
}

void LinuxThreadlineModel::pair(const std::vector<ProbePlan*>& leaves) const {
    // Which leaves listen to which marker text: one pass over the markers serves every probe.
    struct Listener {
        std::uint32_t leaf;
        bool begin;
    };
    std::vector<std::vector<Listener>> listeners(texts_.size());
    for (std::uint32_t l = 0; l < leaves.size(); ++l) {
        if (const auto b = texts_.find(leaves[l]->begin); b != texts_.end()) {
            listeners[b->second].push_back({l, true});
        }
        if (const auto e = texts_.find(leaves[l]->end); e != texts_.end()) {
            listeners[e->second].push_back({l, false});
        }
    }

    struct Interval {
        std::int64_t begin;
        std::int32_t pid;
        std::uint64_t duration;
    };
    std::vector<std::vector<Interval>> intervals(leaves.size());
    // Open begins per (leaf, task), innermost last.
    std::unordered_map<std::uint64_t, std::vector<std::int64_t>> open;
    const auto key = [](std::uint32_t leaf, std::int32_t pid) {
        return (std::uint64_t{leaf} << 32) | static_cast<std::uint32_t>(pid);
    };
    for (const Marker& marker : markers_) {
        for (const Listener& listener : listeners[marker.text]) {
            if (listener.begin) {
                open[key(listener.leaf, marker.pid)].push_back(marker.ns);
                continue;
            }
            const auto stack = open.find(key(listener.leaf, marker.pid));
            if (stack == open.end() || stack->second.empty()) {
                ++leaves[listener.leaf]->unmatchedEnds;
                continue;
            }
            const std::int64_t begin = stack->second.back();
            stack->second.pop_back();
            const std::uint64_t duration =
                marker.ns > begin ? static_cast<std::uint64_t>(marker.ns - begin) : 0;
            intervals[listener.leaf].push_back({begin, marker.pid, duration});
        }
    }
    for (const auto& [k, stack] : open) {
        leaves[k >> 32]->unpairedBegins += stack.size();
    }

    for (std::size_t l = 0; l < leaves.size(); ++l) {
        auto& found = intervals[l];
        // Pairs come out in the order they ended; events are given in the order they began.
        std::stable_sort(found.begin(), found.end(), [](const Interval& a, const Interval& b) {
            return a.begin != b.begin ? a.begin < b.begin : a.pid < b.pid;
        });
        ProbePlan& leaf = *leaves[l];
        leaf.events.reserve(found.size());
        for (const Interval& interval : found) {
            leaf.events.push_back({leaf.name, interval.duration});
        }
    }
}

ThreadlineProbe LinuxThreadlineModel::toProbe(ProbePlan&& plan) {
    ThreadlineProbe probe;
    probe.name = std::move(plan.name);
    if (plan.children.empty()) {
        probe.description = fmt::format(
            "<ThreadlineProbe name=\"{}\" begin=\"{}\" end=\"{}\" events={} unpairedBegins={} "
            "unmatchedEnds={}>",
            probe.name, plan.begin, plan.end, plan.events.size(), plan.unpairedBegins,
            plan.unmatchedEnds);
        probe.events = std::move(plan.events);
        return probe;
    }
    std::string names;
    for (auto& child : plan.children) {
        names += names.empty() ? "" : ",";
        names += child.name;
        probe.children.push_back(toProbe(std::move(child)));
    }
    probe.description =
        fmt::format("<ThreadlineProbe name=\"{}\" children=[{}]>", probe.name, names);
    return probe;
}

std::vector<ThreadlineProbe> LinuxThreadlineModel::probesFromDictionaries(
    const std::vector<Dictionary>& dictionaries, std::vector<std::string>* problems) const {
    std::vector<ProbePlan> plans;
    for (std::size_t i = 0; i < dictionaries.size(); ++i) {
        ProbePlan plan;
        if (buildPlan(dictionaries[i], fmt::format("probe {}", i), 0, plan, problems)) {
            plans.push_back(std::move(plan));
        }
    }
    std::vector<ProbePlan*> leaves;
    for (auto& plan : plans) {
        collectLeaves(plan, leaves);
    }
    pair(leaves);
    std::vector<ThreadlineProbe> probes;
    probes.reserve(plans.size());
    for (auto& plan : plans) {
        probes.push_back(toProbe(std::move(plan)));
    }
    return probes;
}

// Feeds whole lines of a stream of chunks to the model.
class LineSplitter {
  public:
    explicit LineSplitter(LinuxThreadlineModel& model) : model_(model) {}
    void feed(std::string_view chunk) {
        while (!chunk.empty()) {
            const auto nl = chunk.find('\n');
            if (nl == std::string_view::npos) {
                partial_.append(chunk);
                return;
            }
            if (partial_.empty()) {
                model_.addLine(chunk.substr(0, nl));
            } else {
                partial_.append(chunk.substr(0, nl));
                model_.addLine(partial_);
                partial_.clear();
            }
            chunk.remove_prefix(nl + 1);
        }
    }
    void finish() {
        if (!partial_.empty()) {
            model_.addLine(partial_);
            partial_.clear();
        }
    }

  private:
    LinuxThreadlineModel& model_;
    std::string partial_;
};

}  // namespace

ThreadlineModelReader::Built LinuxThreadlineModelReader::modelFromTraceText(std::string_view text) {
    auto model = std::make_shared<LinuxThreadlineModel>();
    LineSplitter lines(*model);
    lines.feed(text);
    lines.finish();
    return {model, {}};
}

ThreadlineModelReader::Built LinuxThreadlineModelReader::modelFromTraceFile(
    const std::filesystem::path& location) {
    // Non-blocking, so that a FIFO named here cannot hold the caller.
    const int fd = ::open(location.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0) {
        return {nullptr,
                fmt::format("cannot open {}: {}", location.string(), std::strerror(errno))};
    }
    struct stat st {};
    if (::fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
        ::close(fd);
        return {nullptr, fmt::format("{} is not a regular file", location.string())};
    }
    auto model = std::make_shared<LinuxThreadlineModel>();
    LineSplitter lines(*model);
    std::string buffer(kReadChunk, '\0');
    std::uint64_t total = 0;
    int error = 0;
    while (total < maxTraceBytes_) {
        const std::size_t want =
            static_cast<std::size_t>(std::min<std::uint64_t>(kReadChunk, maxTraceBytes_ - total));
        const ssize_t n = ::read(fd, buffer.data(), want);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            error = errno;
            break;
        }
        if (n == 0) {
            break;
        }
        total += static_cast<std::uint64_t>(n);
        lines.feed(std::string_view(buffer.data(), static_cast<std::size_t>(n)));
    }
    if (error == 0 && total >= maxTraceBytes_) {
        char probe = 0;
        if (::read(fd, &probe, 1) > 0) {
            model->noteUnread();
        }
    }
    ::close(fd);
    if (error != 0) {
        return {nullptr,
                fmt::format("cannot read {}: {}", location.string(), std::strerror(error))};
    }
    lines.finish();
    return {model, {}};
}

}  // namespace qv

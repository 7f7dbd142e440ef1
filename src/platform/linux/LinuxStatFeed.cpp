#include "platform/linux/LinuxStatFeed.h"

#include <dirent.h>
#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstring>
#include <limits>
#include <map>

#include "platform/Clock.h"

namespace qv {

namespace {

constexpr std::size_t kMaxNameBytes = 255;
// A kernel counter file is a line; anything longer than this is not one.
constexpr std::size_t kSmallFileBytes = 4096;
// /proc/interrupts grows with the number of CPUs and lines; this bounds what one read keeps.
constexpr std::size_t kLargeFileBytes = 4 * 1024 * 1024;

constexpr std::string_view kStateGroup = "StateTransitionTimes_ms";

// Reads the file whole (at most limit bytes); 0 or the errno of the failure.
int readFile(const std::string& path, std::string& out, std::size_t limit) {
    out.clear();
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return errno;
    }
    char buffer[kSmallFileBytes];
    int error = 0;
    while (out.size() < limit) {
        const ssize_t n = ::read(fd, buffer, sizeof buffer);
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
        out.append(buffer, static_cast<std::size_t>(std::min<std::size_t>(n, limit - out.size())));
    }
    ::close(fd);
    return error;
}

std::string_view trim(std::string_view s) {
    while (!s.empty() && std::isspace(static_cast<unsigned char>(s.front()))) {
        s.remove_prefix(1);
    }
    while (!s.empty() && std::isspace(static_cast<unsigned char>(s.back()))) {
        s.remove_suffix(1);
    }
    return s;
}

// A whole unsigned decimal number, blanks around it allowed.
std::optional<std::uint64_t> parseUnsigned(std::string_view text) {
    text = trim(text);
    std::uint64_t value = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), value);
    if (text.empty() || ec != std::errc() || end != text.data() + text.size()) {
        return std::nullopt;
    }
    return value;
}

// A file holding one unsigned number: 0 or the error (EINVAL for anything but a number).
int readCounter(const std::string& path, std::uint64_t& value) {
    std::string text;
    if (const int error = readFile(path, text, kSmallFileBytes)) {
        return error;
    }
    const auto parsed = parseUnsigned(text);
    if (!parsed) {
        return EINVAL;
    }
    value = *parsed;
    return 0;
}

std::uint64_t saturatingMultiply(std::uint64_t a, std::uint64_t b) {
    std::uint64_t product = 0;
    return __builtin_mul_overflow(a, b, &product) ? std::numeric_limits<std::uint64_t>::max()
                                                  : product;
}

// Names as channels carry them: trimmed, without control characters, at most 255 bytes and
// never cut inside a UTF-8 sequence.
std::string cleanName(std::string_view raw) {
    raw = trim(raw);
    std::string name(raw.substr(0, kMaxNameBytes));
    if (raw.size() > kMaxNameBytes) {
        while (!name.empty() && (static_cast<unsigned char>(name.back()) & 0xC0) == 0x80) {
            name.pop_back();
        }
        if (!name.empty() && static_cast<unsigned char>(name.back()) >= 0xC0) {
            name.pop_back();
        }
    }
    for (char& c : name) {
        const auto u = static_cast<unsigned char>(c);
        if (u < 0x20 || u == 0x7F) {
            c = '?';
        }
    }
    return name;
}

std::optional<std::string> readName(const std::string& path) {
    std::string text;
    if (readFile(path, text, kSmallFileBytes) != 0) {
        return std::nullopt;
    }
    const auto eol = text.find('\n');
    std::string name = cleanName(std::string_view(text).substr(0, eol));
    if (name.empty()) {
        return std::nullopt;
    }
    return name;
}

std::string lower(std::string_view s) {
    std::string out(s);
    std::transform(out.begin(), out.end(), out.begin(),
                   [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
    return out;
}

bool containsAny(const std::string& haystack, std::initializer_list<std::string_view> needles) {
    return std::any_of(needles.begin(), needles.end(),
                       [&](std::string_view n) { return haystack.find(n) != std::string::npos; });
}

// Orders "cpu2" before "cpu10": runs of digits compare as numbers.
bool naturalLess(const std::string& a, const std::string& b) {
    std::size_t i = 0, j = 0;
    while (i < a.size() && j < b.size()) {
        const bool da = std::isdigit(static_cast<unsigned char>(a[i]));
        const bool db = std::isdigit(static_cast<unsigned char>(b[j]));
        if (da && db) {
            std::size_t ei = i, ej = j;
            while (ei < a.size() && std::isdigit(static_cast<unsigned char>(a[ei])))
                ++ei;
            while (ej < b.size() && std::isdigit(static_cast<unsigned char>(b[ej])))
                ++ej;
            std::string_view na(a.data() + i, ei - i), nb(b.data() + j, ej - j);
            while (na.size() > 1 && na.front() == '0')
                na.remove_prefix(1);
            while (nb.size() > 1 && nb.front() == '0')
                nb.remove_prefix(1);
            if (na.size() != nb.size()) {
                return na.size() < nb.size();
            }
            if (na != nb) {
                return na < nb;
            }
            i = ei;
            j = ej;
            continue;
        }
        if (a[i] != b[j]) {
            return a[i] < b[j];
        }
        ++i;
        ++j;
    }
    return a.size() - i < b.size() - j;
}

// Entries of a directory whose names start with prefix followed by digits only, in natural
// order; empty when the directory cannot be read.
std::vector<std::string> numberedEntries(const std::string& dir, std::string_view prefix) {
    std::vector<std::string> names;
    DIR* d = ::opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    while (const dirent* e = ::readdir(d)) {
        const std::string_view name = e->d_name;
        if (name.size() <= prefix.size() || name.substr(0, prefix.size()) != prefix) {
            continue;
        }
        const std::string_view digits = name.substr(prefix.size());
        if (std::all_of(digits.begin(), digits.end(),
                        [](unsigned char c) { return std::isdigit(c); })) {
            names.emplace_back(name);
        }
    }
    ::closedir(d);
    std::sort(names.begin(), names.end(), naturalLess);
    return names;
}

std::vector<std::string> allEntries(const std::string& dir) {
    std::vector<std::string> names;
    DIR* d = ::opendir(dir.c_str());
    if (d == nullptr) {
        return names;
    }
    while (const dirent* e = ::readdir(d)) {
        const std::string_view name = e->d_name;
        if (name != "." && name != "..") {
            names.emplace_back(name);
        }
    }
    ::closedir(d);
    std::sort(names.begin(), names.end(), naturalLess);
    return names;
}

bool exists(const std::string& path) {
    return ::access(path.c_str(), F_OK) == 0;
}

// /proc/interrupts, summed over CPUs: IRQ number to count, and the action list of each line.
struct InterruptLine {
    std::uint64_t count = 0;
    std::string actions;
};

int readInterrupts(const std::string& path, std::map<unsigned, InterruptLine>& lines,
                   bool wantActions) {
    std::string text;
    text.reserve(16 * 1024);
    if (const int error = readFile(path, text, kLargeFileBytes)) {
        return error;
    }
    std::string_view rest = text;
    std::size_t cpus = 0;
    bool header = true;
    while (!rest.empty()) {
        const std::size_t eol = rest.find('\n');
        std::string_view line = rest.substr(0, eol);
        rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 1);
        if (header) {
            // "CPU0 CPU1 ...": one count column per CPU.
            header = false;
            std::size_t at = 0;
            while ((at = line.find("CPU", at)) != std::string_view::npos) {
                ++cpus;
                at += 3;
            }
            continue;
        }
        line = trim(line);
        const std::size_t colon = line.find(':');
        if (colon == std::string_view::npos) {
            continue;
        }
        unsigned irq = 0;
        const auto [end, ec] = std::from_chars(line.data(), line.data() + colon, irq);
        if (ec != std::errc() || end != line.data() + colon) {
            continue;  // NMI, LOC and the other per-CPU rows have names, not numbers
        }
        std::string_view tail = line.substr(colon + 1);
        std::uint64_t sum = 0;
        for (std::size_t c = 0; c < cpus; ++c) {
            tail = trim(tail);
            std::uint64_t v = 0;
            const auto [p, e] = std::from_chars(tail.data(), tail.data() + tail.size(), v);
            if (e != std::errc() || (p != tail.data() + tail.size() && *p != ' ')) {
                break;
            }
            sum += v;
            tail.remove_prefix(static_cast<std::size_t>(p - tail.data()));
        }
        InterruptLine& entry = lines[irq];
        entry.count = sum;
        if (wantActions) {
            // The kernel prints chip, hardware IRQ and type, then two blanks and the actions.
            tail = trim(tail);
            const std::size_t gap = tail.rfind("  ");
            entry.actions = cleanName(gap == std::string_view::npos ? std::string_view()
                                                                    : tail.substr(gap + 2));
        }
    }
    return 0;
}

}  // namespace

// ---- sources: how a group of channels is read ----

struct LinuxStatFeed::Source {
    virtual ~Source() = default;
    // Appends one channel per wanted field that could be read, in the order asked; returns 0 or
    // the error of the first field that could not.
    struct Wanted {
        std::shared_ptr<const StatFeedChannelInfo> info;
        int field = 0;
    };
    virtual int read(const std::vector<Wanted>& wanted, double uptime,
                     std::vector<StatFeedChannel>& out) const = 0;
};

struct LinuxStatFeed::Published {
    std::shared_ptr<const StatFeedChannelInfo> info;
    std::shared_ptr<const Source> source;
    int field = 0;
};

namespace {

using Source = LinuxStatFeed::Source;
using Wanted = Source::Wanted;

StatFeedChannel channelFor(const Wanted& w) {
    StatFeedChannel c;
    c.info = w.info;
    return c;
}

double dutyCycle(std::uint64_t residency, double uptime, double unitsPerSecond) {
    const double covered = uptime * unitsPerSecond;
    return covered > 0 ? std::clamp(static_cast<double>(residency) / covered, 0.0, 1.0) : 0.0;
}

class CounterFileSource final : public Source {
  public:
    explicit CounterFileSource(std::string path) : path_(std::move(path)) {}
    int read(const std::vector<Wanted>& wanted, double,
             std::vector<StatFeedChannel>& out) const override {
        std::uint64_t value = 0;
        if (const int error = readCounter(path_, value)) {
            return error;
        }
        for (const Wanted& w : wanted) {
            StatFeedChannel c = channelFor(w);
            c.simple = value;
            out.push_back(std::move(c));
        }
        return 0;
    }

  private:
    std::string path_;
};

// A PCM substream: field 0 the frames the hardware moved (hw_ptr), field 1 the same in
// milliseconds at the stream's rate.
class PcmSource final : public Source {
  public:
    static constexpr int kFrames = 0;
    static constexpr int kMilliseconds = 1;

    PcmSource(std::string status, std::string hwParams)
        : status_(std::move(status)), hwParams_(std::move(hwParams)) {}

    int read(const std::vector<Wanted>& wanted, double,
             std::vector<StatFeedChannel>& out) const override {
        std::string text;
        if (const int error = readFile(status_, text, kSmallFileBytes)) {
            return error;
        }
        std::uint64_t frames = 0;
        bool open = false;
        if (trim(text) != "closed") {
            const std::size_t at = text.find("hw_ptr");
            if (at == std::string::npos) {
                return EINVAL;
            }
            const std::size_t colon = text.find(':', at);
            const std::size_t eol = text.find('\n', at);
            if (colon == std::string::npos || colon > eol) {
                return EINVAL;
            }
            const auto parsed =
                parseUnsigned(std::string_view(text).substr(colon + 1, eol - colon - 1));
            if (!parsed) {
                return EINVAL;
            }
            frames = *parsed;
            open = true;
        }
        int error = 0;
        for (const Wanted& w : wanted) {
            StatFeedChannel c = channelFor(w);
            if (w.field == kFrames) {
                c.simple = frames;
            } else if (!open) {
                c.simple = 0;
            } else {
                const auto rate = readRate();
                if (!rate || *rate == 0) {
                    error = error ? error : EINVAL;
                    continue;
                }
                c.simple = saturatingMultiply(frames, 1000) / *rate;
            }
            out.push_back(std::move(c));
        }
        return error;
    }

  private:
    std::optional<std::uint64_t> readRate() const {
        std::string text;
        if (readFile(hwParams_, text, kSmallFileBytes) != 0) {
            return std::nullopt;
        }
        // "rate: 48000 (48000/1)"
        const std::size_t at = text.find("rate:");
        if (at == std::string::npos) {
            return std::nullopt;
        }
        std::string_view value = trim(std::string_view(text).substr(at + 5));
        value = value.substr(0, value.find_first_of(" \n"));
        return parseUnsigned(value);
    }

    std::string status_;
    std::string hwParams_;
};

// Every published line of /proc/interrupts comes from this one file, read once per sample.
class InterruptsSource final : public Source {
  public:
    explicit InterruptsSource(std::string path) : path_(std::move(path)) {}
    int read(const std::vector<Wanted>& wanted, double,
             std::vector<StatFeedChannel>& out) const override {
        std::map<unsigned, InterruptLine> lines;
        if (const int error = readInterrupts(path_, lines, /*wantActions=*/false)) {
            return error;
        }
        int error = 0;
        for (const Wanted& w : wanted) {
            const auto it = lines.find(static_cast<unsigned>(w.field));
            if (it == lines.end()) {
                error = error ? error : ENOENT;
                continue;
            }
            StatFeedChannel c = channelFor(w);
            c.simple = it->second.count;
            out.push_back(std::move(c));
        }
        return error;
    }

  private:
    std::string path_;
};

// A state channel whose states are each read from counter files: residency (scaled to
// milliseconds) and, where there is one, a transition count.
class StateFilesSource final : public Source {
  public:
    struct State {
        std::string name;
        std::string residencyPath;
        std::string transitionsPath;  // empty: the kernel keeps no count
    };
    // residencyDivisor, residencyMultiplier: from the file's unit to milliseconds.
    StateFilesSource(std::vector<State> states, std::uint64_t residencyDivisor,
                     std::uint64_t residencyMultiplier)
        : states_(std::move(states)),
          divisor_(residencyDivisor),
          multiplier_(residencyMultiplier) {}

    int read(const std::vector<Wanted>& wanted, double uptime,
             std::vector<StatFeedChannel>& out) const override {
        std::vector<StatFeedState> states;
        states.reserve(states_.size());
        for (const State& s : states_) {
            StatFeedState state;
            state.name = s.name;
            std::uint64_t raw = 0;
            if (const int error = readCounter(s.residencyPath, raw)) {
                return error;
            }
            state.residency = saturatingMultiply(raw / divisor_, multiplier_);
            if (!s.transitionsPath.empty()) {
                if (const int error = readCounter(s.transitionsPath, state.transitions)) {
                    return error;
                }
            }
            states.push_back(std::move(state));
        }
        for (const Wanted& w : wanted) {
            StatFeedChannel c = channelFor(w);
            c.states = states;
            for (StatFeedState& s : c.states) {
                s.dutyCycle = dutyCycle(s.residency, uptime, w.info->residencyUnitsPerSecond);
            }
            out.push_back(std::move(c));
        }
        return 0;
    }

  private:
    std::vector<State> states_;
    std::uint64_t divisor_;
    std::uint64_t multiplier_;
};

// A cpufreq policy's statistics: field 0 the state channel, field 1 the histogram.
class CpuFreqSource final : public Source {
  public:
    static constexpr int kState = 0;
    static constexpr int kHistogram = 1;
    // time_in_state counts in ticks of 10 ms.
    static constexpr std::uint64_t kMillisecondsPerTick = 10;

    CpuFreqSource(std::string timeInState, std::string transTable)
        : timeInState_(std::move(timeInState)), transTable_(std::move(transTable)) {}

    int read(const std::vector<Wanted>& wanted, double uptime,
             std::vector<StatFeedChannel>& out) const override {
        std::string text;
        if (const int error = readFile(timeInState_, text, kLargeFileBytes)) {
            return error;
        }
        // "<kHz> <ticks>" a line.
        std::vector<std::pair<std::uint64_t, std::uint64_t>> rows;
        std::string_view rest = text;
        while (!rest.empty()) {
            const std::size_t eol = rest.find('\n');
            const std::string_view line = trim(rest.substr(0, eol));
            rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 1);
            if (line.empty()) {
                continue;
            }
            const std::size_t blank = line.find_first_of(" \t");
            const auto freq = parseUnsigned(line.substr(0, blank));
            const auto ticks = blank == std::string_view::npos
                                   ? std::nullopt
                                   : parseUnsigned(line.substr(blank + 1));
            if (!freq || !ticks) {
                return EINVAL;
            }
            rows.emplace_back(*freq, saturatingMultiply(*ticks, kMillisecondsPerTick));
        }
        if (rows.empty()) {
            return EINVAL;
        }
        const std::map<std::uint64_t, std::uint64_t> into = transitionsInto();
        for (const Wanted& w : wanted) {
            StatFeedChannel c = channelFor(w);
            if (w.field == kState) {
                for (const auto& [freq, ms] : rows) {
                    StatFeedState s;
                    s.name = std::to_string(freq) + " kHz";
                    s.residency = ms;
                    const auto it = into.find(freq);
                    s.transitions = it == into.end() ? 0 : it->second;
                    s.dutyCycle = dutyCycle(ms, uptime, w.info->residencyUnitsPerSecond);
                    c.states.push_back(std::move(s));
                }
            } else {
                bool any = false;
                for (const auto& [freq, ms] : rows) {
                    const auto bound = static_cast<std::int64_t>(
                        std::min<std::uint64_t>(freq, std::numeric_limits<std::int64_t>::max()));
                    c.buckets.push_back(StatFeedBucket{bound, bound, ms, 0});
                    if (ms > 0) {
                        c.minimum = any ? std::min(c.minimum, bound) : bound;
                        c.maximum = any ? std::max(c.maximum, bound) : bound;
                        any = true;
                    }
                }
            }
            out.push_back(std::move(c));
        }
        return 0;
    }

  private:
    // Column sums of trans_table: the times each frequency was entered. Empty when the kernel
    // keeps no table.
    std::map<std::uint64_t, std::uint64_t> transitionsInto() const {
        std::map<std::uint64_t, std::uint64_t> into;
        std::string text;
        if (transTable_.empty() || readFile(transTable_, text, kLargeFileBytes) != 0) {
            return into;
        }
        std::vector<std::uint64_t> columns;
        std::string_view rest = text;
        while (!rest.empty()) {
            const std::size_t eol = rest.find('\n');
            const std::string_view line = rest.substr(0, eol);
            rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 1);
            const std::size_t colon = line.find(':');
            if (colon == std::string_view::npos) {
                continue;
            }
            const std::string_view head = trim(line.substr(0, colon));
            std::string_view cells = line.substr(colon + 1);
            std::vector<std::uint64_t> numbers;
            while (true) {
                cells = trim(cells);
                if (cells.empty()) {
                    break;
                }
                const std::size_t blank = cells.find_first_of(" \t");
                const auto n = parseUnsigned(cells.substr(0, blank));
                if (!n) {
                    numbers.clear();
                    break;
                }
                numbers.push_back(*n);
                if (blank == std::string_view::npos) {
                    break;
                }
                cells.remove_prefix(blank);
            }
            if (head.empty()) {
                columns = numbers;  // the row of "To" frequencies
            } else if (parseUnsigned(head) && numbers.size() == columns.size()) {
                for (std::size_t i = 0; i < columns.size(); ++i) {
                    into[columns[i]] += numbers[i];
                }
            }
        }
        return into;
    }

    std::string timeInState_;
    std::string transTable_;
};

std::shared_ptr<StatFeedChannelInfo> makeInfo(ChannelStatsFormat format,
                                              std::optional<std::string> driverName,
                                              std::optional<std::string> group,
                                              std::optional<std::string> subgroup,
                                              std::optional<std::string> name,
                                              std::optional<std::string> unit) {
    auto info = std::make_shared<StatFeedChannelInfo>();
    info->format = format;
    info->driverName = std::move(driverName);
    info->group = std::move(group);
    info->subgroup = std::move(subgroup);
    info->name = std::move(name);
    info->unit = std::move(unit);
    return info;
}

struct Card {
    unsigned number = 0;
    std::string id;
    std::string names;  // id, driver, short and long name, lower case, for classification
};

// "N [ID             ]: DRIVER - SHORT NAME" and an indented long name on the next line.
std::vector<Card> readCards(const std::string& path) {
    std::vector<Card> cards;
    std::string text;
    if (readFile(path, text, kLargeFileBytes) != 0) {
        return cards;
    }
    std::string_view rest = text;
    while (!rest.empty()) {
        const std::size_t eol = rest.find('\n');
        const std::string_view raw = rest.substr(0, eol);
        rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 1);
        const std::string_view line = trim(raw);
        const std::size_t open = line.find(" [");
        const std::size_t close = line.find("]:");
        unsigned number = 0;
        if (open == std::string_view::npos || close == std::string_view::npos || close < open) {
            if (!cards.empty() && !line.empty()) {
                cards.back().names += " " + lower(line);  // the long name
            }
            continue;
        }
        const auto [end, ec] = std::from_chars(line.data(), line.data() + open, number);
        if (ec != std::errc() || end != line.data() + open) {
            continue;
        }
        Card card;
        card.number = number;
        card.id = cleanName(line.substr(open + 2, close - open - 2));
        if (card.id.empty()) {
            card.id = "card" + std::to_string(number);
        }
        card.names = lower(line.substr(open));
        cards.push_back(std::move(card));
    }
    return cards;
}

enum class AudioRole { Ordinary, Speaker, Haptics };

AudioRole roleOf(const std::string& lowerNames) {
    if (containsAny(lowerNames, {"speaker", "spk"})) {
        return AudioRole::Speaker;
    }
    if (containsAny(lowerNames, {"haptic", "vibra"})) {
        return AudioRole::Haptics;
    }
    return AudioRole::Ordinary;
}

}  // namespace

LinuxStatFeed::LinuxStatFeed(std::filesystem::path root, const Clock& clock)
    : root_(std::move(root)), clock_(clock) {}

LinuxStatFeed::~LinuxStatFeed() = default;

std::uint64_t LinuxStatFeed::idFor(const std::string& key) {
    // Called with mutex_ held.
    const auto [it, inserted] = ids_.emplace(key, ids_.size() + 1);
    return it->second;
}

std::vector<LinuxStatFeed::Published> LinuxStatFeed::discover() {
    std::vector<Published> all;
    const std::string root = root_.string();
    auto publish = [&](std::shared_ptr<StatFeedChannelInfo> info,
                       std::shared_ptr<const Source> source, int field, const std::string& key) {
        {
            std::lock_guard lock(mutex_);
            info->id = idFor(key);
        }
        all.push_back(Published{std::move(info), std::move(source), field});
    };

    // ALSA: PCM streams and power residencies of each card.
    const std::string asound = root + "/proc/asound";
    for (const Card& card : readCards(asound + "/cards")) {
        const std::string cardName = "card" + std::to_string(card.number);
        const std::string driverName = card.id + "<" + cardName + ">";
        const AudioRole role = roleOf(card.names);
        const std::string cardDir = asound + "/" + cardName;
        for (const std::string& pcm : allEntries(cardDir)) {
            if (pcm.size() < 5 || pcm.rfind("pcm", 0) != 0 ||
                (pcm.back() != 'p' && pcm.back() != 'c')) {
                continue;
            }
            const bool playback = pcm.back() == 'p';
            for (const std::string& sub : numberedEntries(cardDir + "/" + pcm, "sub")) {
                const std::string dir = cardDir + "/" + pcm + "/" + sub;
                if (!exists(dir + "/status")) {
                    continue;
                }
                std::string group = playback ? "Tx" : "Rx";
                std::string subgroup = "IOAudio2";
                if (role == AudioRole::Speaker) {
                    group = "Speaker";
                } else if (role == AudioRole::Haptics) {
                    group = "Haptics";
                    subgroup = "Stats";
                }
                auto source = std::make_shared<PcmSource>(dir + "/status", dir + "/hw_params");
                const std::string stream = cleanName(pcm + " " + sub);
                publish(makeInfo(ChannelStatsFormat::Simple, driverName, group, subgroup,
                                 stream + " frames", "frames"),
                        source, PcmSource::kFrames, dir + "#frames");
                publish(makeInfo(ChannelStatsFormat::Simple, driverName, group, subgroup,
                                 stream + " ms", "ms"),
                        source, PcmSource::kMilliseconds, dir + "#ms");
            }
        }
        const std::string power = root + "/sys/class/sound/" + cardName + "/device/power/";
        if (exists(power + "runtime_active_time")) {
            auto source = std::make_shared<StateFilesSource>(
                std::vector<StateFilesSource::State>{
                    {"active", power + "runtime_active_time", ""},
                    {"suspended", power + "runtime_suspended_time", ""}},
                1, 1);
            publish(makeInfo(ChannelStatsFormat::State, driverName, std::string(kStateGroup),
                             "runtimepm", "power", "ms"),
                    source, 0, power);
        }
    }

    // HDA codecs' power accounting.
    const std::string soundClass = root + "/sys/class/sound";
    for (const std::string& entry : allEntries(soundClass)) {
        if (entry.rfind("hwC", 0) != 0) {
            continue;
        }
        const std::string dir = soundClass + "/" + entry + "/";
        if (!exists(dir + "power_on_acct")) {
            continue;
        }
        const std::string codec = cleanName(entry);
        const std::string chip = readName(dir + "chip_name").value_or("codec");
        auto source = std::make_shared<StateFilesSource>(
            std::vector<StateFilesSource::State>{{"on", dir + "power_on_acct", ""},
                                                 {"off", dir + "power_off_acct", ""}},
            1, 1);
        publish(makeInfo(ChannelStatsFormat::State, chip + "<" + codec + ">",
                         std::string(kStateGroup), "codecpower", codec, "ms"),
                source, 0, dir);
    }

    // Interrupt lines of audio hardware.
    {
        const std::string path = root + "/proc/interrupts";
        std::map<unsigned, InterruptLine> lines;
        if (readInterrupts(path, lines, /*wantActions=*/true) == 0) {
            auto source = std::make_shared<InterruptsSource>(path);
            for (const auto& [irq, line] : lines) {
                const std::string actions = lower(line.actions);
                std::string group, subgroup;
                if (containsAny(actions, {"pdm", "dmic"})) {
                    group = "pdm", subgroup = "irq";
                } else if (containsAny(actions, {"speaker", "spk"})) {
                    group = "Speaker", subgroup = "irq";
                } else if (containsAny(actions, {"haptic", "vibra"})) {
                    group = "Haptics", subgroup = "Stats";
                } else if (containsAny(actions, {"snd", "hda", "audio", "sound", "i2s", "ssp",
                                                 "sof", "asoc", "azx", "mca"})) {
                    group = "irq", subgroup = "MCA";
                } else {
                    continue;
                }
                std::optional<std::string> driverName;
                if (!line.actions.empty()) {
                    driverName = line.actions;
                }
                publish(makeInfo(ChannelStatsFormat::Simple, driverName, group, subgroup,
                                 "irq " + std::to_string(irq), "interrupts"),
                        source, static_cast<int>(irq), path + "#" + std::to_string(irq));
            }
        }
    }

    // CPU idle states, one state channel per CPU.
    const std::string cpuDir = root + "/sys/devices/system/cpu";
    const std::string idleDriver = readName(cpuDir + "/cpuidle/current_driver").value_or("cpuidle");
    for (const std::string& cpu : numberedEntries(cpuDir, "cpu")) {
        const std::string idle = cpuDir + "/" + cpu + "/cpuidle";
        std::vector<StateFilesSource::State> states;
        for (const std::string& state : numberedEntries(idle, "state")) {
            const std::string dir = idle + "/" + state + "/";
            if (!exists(dir + "time")) {
                continue;
            }
            states.push_back({readName(dir + "name").value_or(state), dir + "time", dir + "usage"});
        }
        if (states.empty()) {
            continue;
        }
        // time counts microseconds.
        auto source = std::make_shared<StateFilesSource>(std::move(states), 1000, 1);
        publish(makeInfo(ChannelStatsFormat::State, idleDriver + "<" + cpu + ">",
                         std::string(kStateGroup), "cpuidle", cpu, "ms"),
                source, 0, idle);
    }

    // CPU frequency residencies per policy: a state channel and a histogram.
    const std::string freqDir = cpuDir + "/cpufreq";
    for (const std::string& policy : numberedEntries(freqDir, "policy")) {
        const std::string dir = freqDir + "/" + policy + "/";
        if (!exists(dir + "stats/time_in_state")) {
            continue;
        }
        const std::string driverName =
            readName(dir + "scaling_driver").value_or("cpufreq") + "<" + policy + ">";
        auto source =
            std::make_shared<CpuFreqSource>(dir + "stats/time_in_state", dir + "stats/trans_table");
        publish(makeInfo(ChannelStatsFormat::State, driverName, std::string(kStateGroup), "cpufreq",
                         policy, "ms"),
                source, CpuFreqSource::kState, dir + "#state");
        publish(makeInfo(ChannelStatsFormat::Histogram, driverName, std::string(kStateGroup),
                         "cpufreq", policy, "kHz"),
                source, CpuFreqSource::kHistogram, dir + "#histogram");
    }

    // Network devices' counters.
    const std::string net = root + "/sys/class/net";
    for (const std::string& device : allEntries(net)) {
        const std::string stats = net + "/" + device + "/statistics";
        const std::string deviceName = cleanName(device);
        for (const std::string& counter : allEntries(stats)) {
            std::string group;
            if (counter.rfind("rx_", 0) == 0 || counter == "multicast") {
                group = "Rx";
            } else if (counter.rfind("tx_", 0) == 0 || counter == "collisions") {
                group = "Tx";
            } else {
                continue;
            }
            const std::string path = stats + "/" + counter;
            publish(makeInfo(ChannelStatsFormat::Simple, deviceName, group, std::nullopt,
                             cleanName(counter),
                             counter.find("bytes") != std::string::npos ? "bytes" : "count"),
                    std::make_shared<CounterFileSource>(path), 0, path);
        }
    }
    return all;
}

StatFeedResult<StatFeed::ChannelSetRef> LinuxStatFeed::channelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subgroup) {
    if (!exists(root_.string())) {
        return StatFeedError{ENOENT};
    }
    const auto now = std::chrono::steady_clock::now();
    std::shared_ptr<const Discovery> discovery;
    {
        std::lock_guard lock(mutex_);
        if (discovery_ && now - discoveredAt_ < kDiscoveryReuse) {
            discovery = discovery_;
        }
    }
    if (!discovery) {
        auto fresh = std::make_shared<Discovery>();
        for (Published& p : discover()) {
            fresh->push_back(std::make_shared<const Published>(std::move(p)));
        }
        std::lock_guard lock(mutex_);
        for (const auto& p : *fresh) {
            published_[p->info->id] = p;
        }
        discovery_ = fresh;
        discoveredAt_ = now;
        discovery = std::move(fresh);
    }
    auto set = std::make_shared<StatFeedChannelSet>();
    for (const auto& p : *discovery) {
        if ((!group || p->info->group == group) && (!subgroup || p->info->subgroup == subgroup)) {
            set->push_back(p->info);
        }
    }
    return ChannelSetRef(std::move(set));
}

namespace {

bool sameChannel(const StatFeedChannelInfo& a, const StatFeedChannelInfo& b) {
    return a.id == b.id && a.format == b.format && a.driverName == b.driverName &&
           a.group == b.group && a.subgroup == b.subgroup && a.name == b.name;
}

// A subscription: its channels grouped by source, each source read once per sample.
class LinuxSubscription final : public StatFeedSubscription {
  public:
    struct Read {
        std::shared_ptr<const Source> source;
        std::vector<Wanted> wanted;
    };
    std::vector<Read> reads;
};

}  // namespace

StatFeedResult<StatFeed::Subscribed> LinuxStatFeed::createSubscription(
    const StatFeedChannelSet& channels) {
    if (channels.empty()) {
        return StatFeedError{EINVAL};
    }
    auto subscription = std::make_shared<LinuxSubscription>();
    auto subscribed = std::make_shared<StatFeedChannelSet>();
    std::unordered_map<const Source*, std::size_t> readOf;
    {
        std::lock_guard lock(mutex_);
        for (const auto& info : channels) {
            const auto it = info ? published_.find(info->id) : published_.end();
            // A later discovery makes new descriptions of the same channels: the id and what it
            // describes must match, not the object.
            if (it == published_.end() || !sameChannel(*it->second->info, *info)) {
                return StatFeedError{EINVAL};  // not a channel of this library
            }
            const Published& p = *it->second;
            const auto [slot, inserted] =
                readOf.emplace(p.source.get(), subscription->reads.size());
            if (inserted) {
                subscription->reads.push_back({p.source, {}});
            }
            subscription->reads[slot->second].wanted.push_back({p.info, p.field});
        }
    }
    // The subscribed set in reading order, which is the order of every sample's channels.
    for (const auto& read : subscription->reads) {
        for (const Wanted& w : read.wanted) {
            subscribed->push_back(w.info);
        }
    }
    return Subscribed{std::move(subscription), std::move(subscribed)};
}

StatFeedResult<StatFeed::SamplesRef> LinuxStatFeed::createSamples(
    const StatFeedSubscription& subscription, const StatFeedChannelSet& channels) {
    const auto* mine = dynamic_cast<const LinuxSubscription*>(&subscription);
    if (mine == nullptr) {
        return StatFeedError{EINVAL};
    }
    auto samples = std::make_shared<StatFeedSamples>();
    samples->uptime = clock_.systemUptime();
    samples->channels.reserve(channels.size());
    int firstError = 0;
    for (const auto& read : mine->reads) {
        const int error = read.source->read(read.wanted, samples->uptime, samples->channels);
        if (error != 0 && firstError == 0) {
            firstError = error;
        }
    }
    if (samples->channels.empty()) {
        return StatFeedError{firstError != 0 ? firstError : EIO};
    }
    return SamplesRef(std::move(samples));
}

}  // namespace qv

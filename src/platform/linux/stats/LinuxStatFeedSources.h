// How the Linux stat feed reads a group of channels: one source per counter file, PCM stream,
// interrupt line, set of state files or cpufreq policy, each reading the fields it was asked
// for at one sample. Only LinuxStatFeed.cpp includes this.
//
// Thread safety: a source keeps no state between reads; any thread may read it.
#pragma once

#include <algorithm>
#include <charconv>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/stats/KernelFiles.h"
#include "platform/linux/stats/LinuxStatFeed.h"

namespace qv {

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

namespace statfeed {

using namespace kernelfiles;
using Source = LinuxStatFeed::Source;
using Wanted = Source::Wanted;

constexpr std::string_view kStateGroup = "StateTransitionTimes_ms";

StatFeedChannel channelFor(const Wanted& w) {
    StatFeedChannel c;
    c.info = w.info;
    return c;
}

inline double dutyCycle(std::uint64_t residency, double uptime, double unitsPerSecond) {
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

inline std::shared_ptr<StatFeedChannelInfo> makeInfo(ChannelStatsFormat format,
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

}  // namespace statfeed

}  // namespace qv

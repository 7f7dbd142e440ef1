#include "session/QVReportingUtility.h"

#include <atomic>
#include <charconv>
#include <cmath>
#include <cstdlib>
#include <ctime>
#include <limits>
#include <mutex>
#include <system_error>

#include "platform/Clock.h"
#include "platform/DeviceInformation.h"

namespace qv {

namespace {

constexpr std::string_view kTimestampKey = "qvreporting_timestamp";
constexpr std::string_view kSystemUptimeKey = "systemuptime_sec";
constexpr std::string_view kProcessUptimeKey = "processuptime_ms";
constexpr std::string_view kAppNameKey = "HostApplicationDisplayID";

// ---- Internal build ----

// Not std::call_once: tests must be able to forget the answer and ask again.
enum InternalBuildState : int { kUnknown = 0, kCustomer = 1, kInternal = 2 };
std::atomic<int> gInternalBuildState{kUnknown};
std::mutex gInternalBuildMutex;

// ---- Numbers ----

// Rounds to the nearest integer and clamps into 32 bits; NaN counts as 0. Converting a double
// outside the range of the integer type would be undefined.
std::int32_t roundToInt32(double x) {
    if (std::isnan(x)) {
        return 0;
    }
    const double r = std::round(x);
    if (r >= 2147483647.0) {
        return std::numeric_limits<std::int32_t>::max();
    }
    if (r <= -2147483648.0) {
        return std::numeric_limits<std::int32_t>::min();
    }
    return static_cast<std::int32_t>(r);
}

// More fraction digits than the shortest text of any double has (the smallest subnormal needs
// 324), so a larger `places` means "every digit" and costs no more than this.
constexpr std::uint64_t kMaxFractionDigits = 400;

// The decimal text of x with at most maxFraction and at least minFraction fraction digits,
// rounding half to even on the shortest decimal text that reads back as x (what a person sees
// as the number: 0.25 to one place is 0.2, although the double 0.35 lies below 0.35 and still
// rounds up to 0.4).
std::string formatDecimal(double x, std::uint64_t maxFraction, std::uint64_t minFraction) {
    if (std::isnan(x)) {
        return "NaN";
    }
    if (std::isinf(x)) {
        return x > 0 ? "∞" : "-∞";
    }
    maxFraction = std::min(maxFraction, kMaxFractionDigits);
    minFraction = std::min(minFraction, maxFraction);

    // Shortest round-trip text in scientific form: "-d.ddde+XX".
    char buffer[64];
    const auto [end, ec] =
        std::to_chars(buffer, buffer + sizeof buffer, x, std::chars_format::scientific);
    if (ec != std::errc()) {
        return "NaN";  // cannot happen for a finite double in 64 characters
    }
    const std::string_view text(buffer, static_cast<std::size_t>(end - buffer));
    const bool negative = text.front() == '-';
    const std::size_t ePos = text.find('e');
    std::string digits;
    for (char c : text.substr(negative ? 1 : 0, ePos - (negative ? 1 : 0))) {
        if (c != '.') {
            digits += c;
        }
    }
    const long exponent = std::strtol(std::string(text.substr(ePos + 1)).c_str(), nullptr, 10);

    // Lay the digits out around the decimal point: digits[0, point) is the integer part, with at
    // least one digit, and the rest is the fraction.
    long point = exponent + 1;
    if (point <= 0) {
        digits.insert(0, static_cast<std::size_t>(1 - point), '0');
        point = 1;
    }
    if (static_cast<std::size_t>(point) > digits.size()) {
        digits.append(static_cast<std::size_t>(point) - digits.size(), '0');
    }
    std::size_t integerDigits = static_cast<std::size_t>(point);

    if (digits.size() - integerDigits > maxFraction) {
        const std::size_t keep = integerDigits + maxFraction;
        const char first = digits[keep];
        const bool restNonZero = digits.find_first_not_of('0', keep + 1) != std::string::npos;
        const bool lastKeptOdd = (digits[keep - 1] - '0') % 2 != 0;
        const bool roundUp = first > '5' || (first == '5' && (restNonZero || lastKeptOdd));
        digits.resize(keep);
        if (roundUp) {
            std::size_t i = keep;
            while (i > 0 && digits[i - 1] == '9') {
                digits[--i] = '0';
            }
            if (i == 0) {
                digits.insert(digits.begin(), '1');
                ++integerDigits;
            } else {
                ++digits[i - 1];
            }
        }
    }

    std::string integer = digits.substr(0, integerDigits);
    std::string fraction = digits.substr(integerDigits);
    integer.erase(0, std::min(integer.find_first_not_of('0'), integer.size() - 1));
    while (fraction.size() > minFraction && fraction.back() == '0') {
        fraction.pop_back();
    }
    fraction.append(minFraction - std::min<std::uint64_t>(minFraction, fraction.size()), '0');

    // A negative number that rounds to zero prints as "0", not "-0": a label of "-0" would
    // split one bucket into two.
    const bool isZero = integer == "0" && fraction.find_first_not_of('0') == std::string::npos;
    std::string out = negative && !isZero ? "-" : "";
    out += integer;
    if (!fraction.empty()) {
        out += '.';
        out += fraction;
    }
    return out;
}

}  // namespace

bool QVReportingUtilityShouldSendMessage() {
    return true;
}

bool QVReportingUtilityIsInternalBuild(const Platform& platform) {
    int state = gInternalBuildState.load(std::memory_order_acquire);
    if (state == kUnknown) {
        std::lock_guard lock(gInternalBuildMutex);
        state = gInternalBuildState.load(std::memory_order_relaxed);
        if (state == kUnknown) {
            const std::optional<bool> answer = platform.device.boolAnswer("InternalBuild");
            state = answer.value_or(false) ? kInternal : kCustomer;
            gInternalBuildState.store(state, std::memory_order_release);
        }
    }
    return state == kInternal;
}

void QVReportingUtilityTEST_resetInternalBuild() {
    std::lock_guard lock(gInternalBuildMutex);
    gInternalBuildState.store(kUnknown, std::memory_order_release);
}

std::string QVReportingUtilityRetrieveAppName(const Dictionary& dictionary) {
    const Value* name = dictionary.find(kAppNameKey);
    return name ? QVReportingValueText(name) : "Unknown";
}

double QVReportingUtilityVolumeMinimumPlayingTime(AudioServiceType /*serviceType*/) {
    return 0.5;
}

Dictionary QVReportingUtilityAddDates(const Dictionary& dictionary, const Clock& clock) {
    Dictionary out = dictionary;
    out.set(kTimestampKey, clock.now());
    out.set(kSystemUptimeKey, roundToInt32(clock.systemUptime()));
    // Single precision is part of the stamp's definition, so stamps stay comparable with those
    // of other producers; past 2^24 ms (4.6 hours of processor time) it skips whole milliseconds.
    const float milliseconds = static_cast<float>(clock.processCPUTime()) / 1000000.0f * 1000.0f;
    out.set(kProcessUptimeKey, roundToInt32(static_cast<double>(std::round(milliseconds))));
    return out;
}

double QVReportingUtilityRoundWithPlaces(double value, std::int32_t places) {
    if (!std::isfinite(value)) {
        return value;
    }
    // 2^53: from here on a double has no fraction digits left to round away.
    constexpr double kIntegral = 9007199254740992.0;
    if (places >= 0) {
        const double p = std::pow(10.0, static_cast<double>(places));
        const double scaled = value * p;
        if (!std::isfinite(scaled) || std::fabs(scaled) >= kIntegral) {
            return value;
        }
        return std::round(scaled) / p;
    }
    // Dividing by the exact power of ten is more precise than multiplying by its inexact
    // inverse (10^-2 has no exact double; 100 has).
    const double q = std::pow(10.0, -static_cast<double>(places));
    if (!std::isfinite(q)) {
        return std::copysign(0.0, value);
    }
    return std::round(value / q) * q;
}

std::optional<std::string> QVReportingUtilityBucketNumberToString(
    double value, const std::vector<double>& buckets, std::uint64_t places) {
    std::optional<double> best;
    double previousDistance = -1;
    for (const double bucket : buckets) {
        const double distance = std::fabs(value - bucket);
        if (previousDistance >= 0 && distance > previousDistance) {
            break;
        }
        best = bucket;
        previousDistance = distance;
    }
    if (!best) {
        return std::nullopt;
    }
    return formatDecimal(*best, places, places > 0 ? 1 : 0);
}

bool QVReportingUtilityKeyIsPresentAndHasChanged(std::string_view key, const Dictionary* current,
                                                 const Dictionary* previous) {
    if (current == nullptr || previous == nullptr) {
        return false;
    }
    const Value* now = current->find(key);
    const Value* before = previous->find(key);
    if (now == nullptr || before == nullptr) {
        return false;
    }
    return *now != *before;
}

std::string QVReportingUtilityFileTimestamp(double wallSeconds) {
    const auto seconds = std::isfinite(wallSeconds) ? static_cast<time_t>(wallSeconds) : 0;
    tm local{};
    localtime_r(&seconds, &local);
    char text[32];
    const std::size_t n = strftime(text, sizeof text, "%Y%m%d-%H%M%S%z", &local);
    return std::string(text, n);
}

}  // namespace qv

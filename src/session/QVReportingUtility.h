// Shared helpers of the service, the sessions and the workers: the internal-build switch, time
// stamping of payloads, rounding and bucketing of numbers for telemetry, and change detection
// between two payloads. The names are the daemon's exported names and stay as they are.
//
// Thread safety: every function may be called from any thread. Only the internal-build flag is
// kept between calls, and it is computed once under a lock.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Platform.h"
#include "session/QVReportingVocabulary.h"
#include "values/Value.h"

namespace qv {

class Clock;

// Always true; exported for clients, no caller inside the service consults it.
bool QVReportingUtilityShouldSendMessage();

// Whether this is an internal build. The first call in the process asks the device under
// "InternalBuild" (false when the device does not answer); every later call returns that answer
// without asking again, whichever platform it is given.
bool QVReportingUtilityIsInternalBuild(const Platform& platform);
// For tests only: forgets the stored answer, so that the next call asks again.
void QVReportingUtilityTEST_resetInternalBuild();

// The string under "HostApplicationDisplayID", or "Unknown" when the key is absent. A value of
// another kind is given as its printed form rather than dropped, so that a client that sends a
// number still gets a stable name.
std::string QVReportingUtilityRetrieveAppName(const Dictionary& dictionary);

// Seconds a playback stretch must last before the volume worker reports it: 0.5 for every
// service type. The service type is not consulted yet; it keeps the signature ready for a
// per-service table.
double QVReportingUtilityVolumeMinimumPlayingTime(AudioServiceType serviceType);

// A copy of dictionary with the three time stamps set, replacing any already there:
// "qvreporting_timestamp" (wall clock, seconds since 1970, double), "systemuptime_sec" (whole
// seconds since boot) and "processuptime_ms" (processor time of this process, whole
// milliseconds, computed in single precision). Integers that do not fit 32 bits are clamped.
Dictionary QVReportingUtilityAddDates(const Dictionary& dictionary, const Clock& clock);

// round(value * 10^places) / 10^places, halves away from zero; negative places round to tens,
// hundreds and so on. Values that are not finite come back unchanged, as do values that already
// have no digits below 10^-places; when 10^-places is beyond every double, the result is zero.
double QVReportingUtilityRoundWithPlaces(double value, std::int32_t places);

// The label of the bucket nearest to value: buckets are walked in order, and the walk stops as
// soon as the distance grows (callers pass ascending buckets; on a tie the later bucket wins).
// The bucket's own value is printed with at most `places` fraction digits (at least one when
// places > 0), "." as separator, no grouping; digits beyond `places` are rounded half to even.
// Nothing when buckets is empty.
std::optional<std::string> QVReportingUtilityBucketNumberToString(
    double value, const std::vector<double>& buckets, std::uint64_t places);

// True when both dictionaries are present, both hold key, and the two values differ (numbers
// compare by value: 1 and 1.0 are equal).
bool QVReportingUtilityKeyIsPresentAndHasChanged(std::string_view key, const Dictionary* current,
                                                 const Dictionary* previous);

// The local time of wallSeconds as "yyyyMMdd-HHmmssZ" (e.g. "20240131-142501+0100"), the stamp
// that begins the names of the files sessions leave behind; a time that is not finite is 1970.
std::string QVReportingUtilityFileTimestamp(double wallSeconds);

}  // namespace qv

#include "output/MWTime.h"

#include <cmath>

#include "platform/MWHostInterface.h"

namespace {

/// From 1970-01-01 to 2001-01-01, both 00:00:00 UTC.
constexpr int64_t kReferenceDateSeconds = 978307200;

mach_timebase_info_t hostTimebase() {
    static const mach_timebase_info_t info = MWHostInterface::current().mach_timebase_info();
    return info;
}

}  // namespace

std::optional<MWTime> MWTime::now() {
    MWClockReading reading;
    if (MWHostInterface::current().mach_get_times(reading) != 0) {
        return std::nullopt;
    }
    return MWTime(reading);
}

MWTime::MWTime(const MWClockReading& reading)
    : _machAbsoluteTime(reading.absoluteTicks),
      _machContinuousTime(reading.continuousTicks),
      _wallTime((static_cast<double>(reading.wallSeconds) - static_cast<double>(kReferenceDateSeconds)) +
                static_cast<double>(reading.wallNanoseconds) * 1e-9) {}

uint64_t MWTime::machAbsoluteTimeNsec() const {
    return nanosecondsForTicks(_machAbsoluteTime, hostTimebase());
}

uint64_t MWTime::machContinuousTimeNsec() const {
    return nanosecondsForTicks(_machContinuousTime, hostTimebase());
}

std::chrono::sys_time<std::chrono::nanoseconds> MWTime::date() const {
    // Whole seconds apart, so that the fraction keeps all its bits.
    const double seconds = std::floor(_wallTime);
    return std::chrono::sys_time<std::chrono::nanoseconds>(
        std::chrono::seconds(static_cast<int64_t>(seconds) + kReferenceDateSeconds) +
        std::chrono::nanoseconds(std::llround((_wallTime - seconds) * 1e9)));
}

uint64_t MWTime::nanosecondsForTicks(uint64_t ticks, mach_timebase_info_t timebase) {
    return timebase.denom == 0 ? 0 : ticks * timebase.numer / timebase.denom;
}

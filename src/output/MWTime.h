#pragma once

#include <chrono>
#include <cstdint>
#include <optional>

#include "platform/MWHostRecords.h"

/// One instant, read from three clocks at once.
class MWTime {
public:
    /// The current instant, or nothing when the host refuses the clock reading.
    static std::optional<MWTime> now();

    explicit MWTime(const MWClockReading& reading);

    /// Ticks of the monotonic clock that stops while the system sleeps.
    uint64_t machAbsoluteTime() const { return _machAbsoluteTime; }
    /// Ticks of the monotonic clock that counts through sleep.
    uint64_t machContinuousTime() const { return _machContinuousTime; }
    /// Seconds since 2001-01-01 00:00:00 UTC.
    double wallTime() const { return _wallTime; }
    uint64_t machAbsoluteTimeNsec() const;
    uint64_t machContinuousTimeNsec() const;
    /// `wallTime` as a calendar instant, to the nanosecond that a double can hold.
    std::chrono::sys_time<std::chrono::nanoseconds> date() const;

    /// Ticks to nanoseconds; the product wraps modulo 2^64, a denominator of 0 gives 0.
    static uint64_t nanosecondsForTicks(uint64_t ticks, mach_timebase_info_t timebase);

private:
    uint64_t _machAbsoluteTime;
    uint64_t _machContinuousTime;
    double _wallTime;
};

#pragma once

#include <cstdint>

/// When a timer fires, in nanoseconds.
struct MWTimerSchedule {
    uint64_t firstAfter;  ///< from now
    uint64_t interval;    ///< above 0
    uint64_t leeway;      ///< how late a fire may come where the system saves power by it
};

/// A repeating timer. Its handler runs on a serial queue and is given the number of fires since it ran last:
/// fires that come while it runs are counted, not queued.
class MWTimer {
public:
    virtual ~MWTimer() = default;
    /// Also replaces the schedule of a timer that runs.
    virtual void arm(const MWTimerSchedule& schedule) = 0;
    /// No further fires; a handler that runs goes on.
    virtual void cancel() = 0;
};

#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <mutex>
#include <semaphore>
#include <vector>

#include "analysis/MWMemweight.h"
#include "cli/MWMemweightArgs.h"
#include "output/MWOutputFormatter.h"
#include "platform/MWTimer.h"
#include "platform/MWWorkQueue.h"

/// Measures at an interval until it is interrupted; each measurement is one sample of the same outputs.
///
/// Samples are gathered on the timer queue and written on the analysis queue, in the order of their fires, so
/// that the next one can be gathered while this one is written. Where gathering takes longer than the
/// interval, the interval grows; where writing does, samples are left out. Also ends when nobody reads
/// standard output any more.
class MWSampling {
public:
    using Formatters = std::vector<std::unique_ptr<MWOutputFormatter>>;

    /// Both outlive the loop.
    MWSampling(MWMemweightArgs& args, const Formatters& formatters);

    /// Returns when sampling has stopped and everything queued is written; false when there is no timer to be
    /// had, which is then told on standard error.
    bool run();

private:
    void _fire(uint64_t fires);
    void _keepUp(uint64_t fires, uint64_t now);
    void _sample();
    MWTargetMap _resolveTargets();
    void _print(MWMemweight& memweight);
    /// Once the gathering in progress is told to end, `message` goes to standard error.
    void _stop(const char* message);

    MWMemweightArgs& _args;
    const Formatters& _formatters;
    std::binary_semaphore _done = std::binary_semaphore(0);
    std::atomic<bool> _isStopping = false;

    // Of the timer queue, once it runs. Nanoseconds of the uptime clock.
    uint64_t _interval;
    uint64_t _leeway;
    uint64_t _lastFire = 0;
    bool _isFirstOverrun = true;
    bool _isFirstLeftOut = true;

    // The latest sample's, for as long as it is gathered or waits for its output.
    std::mutex _currentMutex;
    std::weak_ptr<MWMemweight> _current;

    MWSerialQueue _analysisQueue;
    MWSerialQueue _timerQueue;
    std::unique_ptr<MWTimer> _timer;
};

#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>

#include "platform/MWTimer.h"
#include "platform/MWWorkQueue.h"
#include "platform/linux/Procfs.h"

/// A timer of the monotonic clock, which stands still while the system sleeps. Fires on the grid of its
/// schedule whatever the handler does; leeway is not made use of.
class LinuxTimer : public MWTimer {
public:
    using Handler = std::function<void(uint64_t fires)>;

    /// `queue` outlives the timer. None with errno when no descriptors are left.
    static std::unique_ptr<LinuxTimer> create(MWSerialQueue& queue, Handler handler);
    /// The handler may still be waiting in the queue, where it then does nothing.
    ~LinuxTimer() override;
    LinuxTimer(const LinuxTimer&) = delete;
    LinuxTimer& operator=(const LinuxTimer&) = delete;

    void arm(const MWTimerSchedule& schedule) override;
    void cancel() override;

private:
    /// What a handler in the queue needs when the timer is gone.
    struct Firing {
        Handler handler;
        std::atomic<uint64_t> fires = 0;
        std::atomic<bool> isQueued = false;
        std::atomic<bool> isCancelled = false;
    };

    LinuxTimer(MWSerialQueue& queue, Handler handler);
    void _wait();
    /// False when there are none to count.
    bool _countFires();
    void _queueHandler();

    MWSerialQueue& _queue;
    std::shared_ptr<Firing> _firing;
    std::mutex _mutex;  ///< held while the schedule changes and while fires are counted
    procfs::Descriptor _timer;
    procfs::Descriptor _ended;  ///< eventfd
    std::thread _thread;
};

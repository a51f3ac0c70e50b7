#include "platform/linux/LinuxTimer.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/timerfd.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <ctime>
#include <utility>

#include "platform/MWSignalMask.h"

namespace {

timespec timespecOf(uint64_t nanoseconds) {
    constexpr uint64_t kPerSecond = 1'000'000'000;
    return {.tv_sec = static_cast<time_t>(nanoseconds / kPerSecond),
            .tv_nsec = static_cast<long>(nanoseconds % kPerSecond)};
}

}  // namespace

std::unique_ptr<LinuxTimer> LinuxTimer::create(MWSerialQueue& queue, Handler handler) {
    std::unique_ptr<LinuxTimer> timer(new LinuxTimer(queue, std::move(handler)));
    if (!timer->_timer || !timer->_ended) {
        return nullptr;
    }
    const MWSignalMask mask;
    timer->_thread = std::thread([raw = timer.get()] { raw->_wait(); });
    return timer;
}

LinuxTimer::LinuxTimer(MWSerialQueue& queue, Handler handler)
    : _queue(queue),
      _firing(std::make_shared<Firing>()),
      _timer(timerfd_create(CLOCK_MONOTONIC, TFD_CLOEXEC | TFD_NONBLOCK)),
      _ended(eventfd(0, EFD_CLOEXEC)) {
    _firing->handler = std::move(handler);
}

LinuxTimer::~LinuxTimer() {
    _firing->isCancelled = true;
    if (_thread.joinable()) {
        eventfd_write(_ended.get(), 1);
        _thread.join();
    }
}

// A time of 0 would disarm the timer: the soonest there is.
void LinuxTimer::arm(const MWTimerSchedule& schedule) {
    const itimerspec times = {.it_interval = timespecOf(schedule.interval),
                              .it_value = timespecOf(std::max<uint64_t>(schedule.firstAfter, 1))};
    // A fire of the schedule before that is counted later would pass for one of this.
    const std::lock_guard lock(_mutex);
    _firing->fires = 0;
    timerfd_settime(_timer.get(), 0, &times, nullptr);
}

void LinuxTimer::cancel() {
    const itimerspec never = {};
    _firing->isCancelled = true;
    timerfd_settime(_timer.get(), 0, &never, nullptr);
}

void LinuxTimer::_wait() {
    std::array<pollfd, 2> waits = {{{_ended.get(), POLLIN, 0}, {_timer.get(), POLLIN, 0}}};
    while (poll(waits.data(), waits.size(), -1) >= 0 || errno == EINTR) {
        if ((waits[0].revents & POLLIN) != 0) {
            return;
        }
        if (_countFires()) {
            _queueHandler();
        }
    }
}

bool LinuxTimer::_countFires() {
    const std::lock_guard lock(_mutex);
    uint64_t fires = 0;
    const bool hasFired = read(_timer.get(), &fires, sizeof(fires)) == sizeof(fires);
    _firing->fires += hasFired ? fires : 0;
    return hasFired;
}

void LinuxTimer::_queueHandler() {
    if (_firing->isQueued.exchange(true)) {
        return;
    }
    _queue.async([firing = _firing] {
        firing->isQueued = false;
        const uint64_t fires = firing->fires.exchange(0);
        if (fires != 0 && !firing->isCancelled) {
            firing->handler(fires);
        }
    });
}

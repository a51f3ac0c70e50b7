#include "platform/MWWatchedWork.h"

#include <algorithm>
#include <system_error>
#include <utility>

#include "platform/MWHostInterface.h"
#include "platform/MWProgress.h"
#include "platform/MWWorkQueue.h"

namespace {

constexpr uint64_t kLookInterval = 100'000'000;

/// Threads that go on after they were given up. Never destroyed: they may outlive everything.
struct GivenUpThreads {
    std::mutex mutex;
    std::vector<std::thread> threads;  ///< guarded by it
};

GivenUpThreads& givenUpThreads() {
    static auto& threads = *new GivenUpThreads;
    return threads;
}

}  // namespace

std::vector<size_t> MWWatchedWork::run(std::function<void()> setUpThread) {
    _setUpThread = std::move(setUpThread);
    {
        std::unique_lock lock(_mutex);
        if (_addWorkers(threadsFor(_count))) {
            _watch(lock);
        }
    }
    _joinAll();
    // Where there are no threads to be had, or no more of them, this one does the work, and nobody watches.
    Worker lastResort;
    while (_takeNext(lastResort)) {
        _work(*lastResort.item);
    }
    std::ranges::sort(_givenUp);
    return std::move(_givenUp);
}

size_t MWWatchedWork::threadsFor(size_t count) {
    return std::min<size_t>(count, std::max(1U, std::thread::hardware_concurrency()));
}

/// False when there is none now.
bool MWWatchedWork::_addWorkers(size_t workers) {
    try {
        for (; workers > 0; --workers) {
            auto worker = std::make_unique<Worker>();
            worker->thread =
                std::thread([self = shared_from_this(), raw = worker.get()] { self->_workAs(*raw); });
            _workers.push_back(std::move(worker));
            ++_active;
        }
    } catch (const std::system_error&) {
        // Those that there are do it.
    }
    return _active != 0;
}

void MWWatchedWork::_workAs(Worker& worker) {
    _setUpThread();
    MWProgress::countIn(&worker.steps);
    while (_takeNext(worker)) {
        _work(*worker.item);
        MWProgress::mark();
    }
    MWProgress::countIn(nullptr);
}

/// False when there is nothing left to do for this worker.
bool MWWatchedWork::_takeNext(Worker& worker) {
    const std::lock_guard lock(_mutex);
    worker.item.reset();
    if (worker.isGivenUp) {
        return false;
    }
    if (_next < _count) {
        worker.item = _next++;
        return true;
    }
    if (worker.thread.joinable()) {
        --_active;
        _changed.notify_one();
    }
    return false;
}

void MWWatchedWork::_watch(std::unique_lock<std::mutex>& lock) {
    MWHostInterface& host = MWHostInterface::current();
    uint64_t looked = host.uptimeNanoseconds();
    while (_active != 0) {
        host.waitForChange(lock, _changed, kLookInterval);
        const uint64_t now = host.uptimeNanoseconds();
        // While this program itself was stopped nobody could get any further.
        const uint64_t elapsed = std::min(now - looked, 2 * kLookInterval);
        looked = now;
        // One that is given up can be followed by another.
        for (size_t index = 0; index != _workers.size(); ++index) {  // NOLINT(modernize-loop-convert)
            _lookAt(*_workers[index], elapsed);
        }
    }
}

void MWWatchedWork::_lookAt(Worker& worker, uint64_t elapsed) {
    const uint64_t steps = worker.steps;
    if (!worker.item || worker.isGivenUp || steps != std::exchange(worker.seenSteps, steps)) {
        worker.quiet = 0;
        return;
    }
    worker.quiet += elapsed;
    if (worker.quiet >= MWConcurrentQueue::patience) {
        _giveUp(worker);
    }
}

void MWWatchedWork::_giveUp(Worker& worker) {
    worker.isGivenUp = true;
    _givenUp.push_back(*worker.item);
    --_active;
    if (_next < _count) {
        _addWorkers(1);
    }
}

void MWWatchedWork::_joinAll() {
    for (const auto& worker : _workers) {
        const bool isGivenUp = [&] {
            const std::lock_guard lock(_mutex);
            return worker->isGivenUp;
        }();
        if (!isGivenUp) {
            worker->thread.join();
            continue;
        }
        const std::lock_guard lock(givenUpThreads().mutex);
        givenUpThreads().threads.push_back(std::move(worker->thread));
    }
}

bool MWWatchedWork::hasGivenUp() {
    const std::lock_guard lock(givenUpThreads().mutex);
    return !givenUpThreads().threads.empty();
}

void MWWatchedWork::awaitGivenUp() {
    const std::lock_guard lock(givenUpThreads().mutex);
    for (std::thread& thread : givenUpThreads().threads) {
        thread.join();
    }
    givenUpThreads().threads.clear();
}

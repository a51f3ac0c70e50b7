#pragma once

#include <atomic>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>
#include <vector>

/// The work of one MWConcurrentQueue::apply: its items, the threads that do them, and who gives them up. Held
/// by a shared_ptr, which each of its threads holds as well.
class MWWatchedWork : public std::enable_shared_from_this<MWWatchedWork> {
public:
    MWWatchedWork(size_t count, std::function<void(size_t)> work) : _count(count), _work(std::move(work)) {}

    /// To be called once; see MWConcurrentQueue::apply. Each thread calls `setUpThread` first.
    std::vector<size_t> run(std::function<void()> setUpThread);

    /// How many threads so many items get.
    static size_t threadsFor(size_t count);
    static bool hasGivenUp();
    static void awaitGivenUp();

private:
    struct Worker {
        std::atomic<uint64_t> steps = 0;  ///< of all its items
        std::thread thread = {};          ///< none for the one that runs `run`
        std::optional<size_t> item = {};  ///< at work on
        bool isGivenUp = false;
        uint64_t seenSteps = 0;  ///< when it was last looked at
        uint64_t quiet = 0;      ///< nanoseconds since it marked the last one
    };

    bool _addWorkers(size_t workers);
    void _workAs(Worker& worker);
    bool _takeNext(Worker& worker);
    void _watch(std::unique_lock<std::mutex>& lock);
    void _lookAt(Worker& worker, uint64_t elapsed);
    void _giveUp(Worker& worker);
    void _joinAll();

    const size_t _count;
    const std::function<void(size_t)> _work;
    std::function<void()> _setUpThread;
    std::vector<std::unique_ptr<Worker>> _workers;  ///< of the thread that runs `run` alone

    std::mutex _mutex;  ///< guards what follows and the workers' items
    std::condition_variable _changed;
    size_t _next = 0;
    size_t _active = 0;  ///< workers that have not ended and were not given up
    std::vector<size_t> _givenUp;
};

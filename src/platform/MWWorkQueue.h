#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>

/// Scheduling classes for work: the values are fixed by the design, the effect is a nice value of the
/// queue's threads (interactive work is not slowed by a measurement in the background).
inline constexpr uint32_t QOS_CLASS_UTILITY = 17;
inline constexpr uint32_t QOS_CLASS_USER_INITIATED = 25;

/// A concurrent queue: work items start in index order on as many threads as there are processors.
class MWConcurrentQueue {
public:
    MWConcurrentQueue(std::string label, uint32_t qualityOfService);

    /// Runs work(0) ... work(count - 1) and returns when all of them have ended.
    void apply(size_t count, const std::function<void(size_t)>& work) const;

    const std::string& label() const { return _label; }

private:
    std::string _label;
    uint32_t _qualityOfService;
};

/// A serial queue: work items run one after the other, in the order in which they were queued, on a thread of
/// the queue's own.
class MWSerialQueue {
public:
    MWSerialQueue(std::string label, uint32_t qualityOfService);
    /// Runs what is queued.
    ~MWSerialQueue();
    MWSerialQueue(const MWSerialQueue&) = delete;
    MWSerialQueue& operator=(const MWSerialQueue&) = delete;

    void async(std::function<void()> work);
    /// Returns when `work` and everything queued before it has run. Not to be called from the queue itself.
    void sync(const std::function<void()>& work);
    /// Items that have not begun.
    size_t waiting() const;

    const std::string& label() const { return _label; }

private:
    void _run(uint32_t qualityOfService);
    std::function<void()> _next();

    std::string _label;
    mutable std::mutex _mutex;  ///< guards what follows
    std::condition_variable _changed;
    std::deque<std::function<void()>> _items;
    bool _ended = false;
    std::thread _thread;
};

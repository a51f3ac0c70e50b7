#pragma once

#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <deque>
#include <functional>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

/// Scheduling classes for work: the values are fixed by the design. The effect is a nice value of the threads
/// of serial queues, so that interactive work is not slowed by what is written in the background. Those of
/// concurrent queues have none: while one of them waits for a processor, the kernel can be holding the memory
/// map of a measured process for it, and makes that process wait as well.
inline constexpr uint32_t QOS_CLASS_UTILITY = 17;
inline constexpr uint32_t QOS_CLASS_USER_INITIATED = 25;

/// A concurrent queue: work items start in index order on as many threads as there are processors.
///
/// The system can take for ever to answer, for example about a process whose memory map is locked. An item
/// that marks no step (see MWProgress) for `patience` is given up, and another thread does the rest.
class MWConcurrentQueue {
public:
    /// Nanoseconds of the host's uptime clock.
    static constexpr uint64_t patience = 10'000'000'000;

    MWConcurrentQueue(std::string label, uint32_t qualityOfService);

    /// Runs work(0) ... work(count - 1). Returns when each has ended or was given up, with the indices of the
    /// latter, ascending. An item that was given up goes on should it get its answer after all: whatever
    /// `work` touches has to be owned by it, and the caller must not look at what such an item makes.
    std::vector<size_t> apply(size_t count, std::function<void(size_t)> work) const;

    /// Whether there are items given up that go on.
    static bool hasGivenUp();
    /// Returns when every item that was given up has ended after all.
    static void awaitGivenUp();

    const std::string& label() const { return _label; }
    /// What an item leaves behind, in bytes: each thread makes room for its share at once (see MWHeap.h).
    void setBytesKeptOfItem(size_t bytes) { _bytesKeptOfItem = bytes; }

private:
    std::string _label;
    size_t _bytesKeptOfItem = 0;
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

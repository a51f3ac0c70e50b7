#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>

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

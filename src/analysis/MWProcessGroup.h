#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "model/MWMemoryCategory.h"
#include "process/MWProcess.h"

/// Processes in ascending order of pid, each pid once. Not owned: the analysis object owns its processes.
using MWProcessSet = std::vector<const MWProcess*>;

/// A growing set of processes, used while the sharers of each memory object are collected.
class MWProcessGroupMinimal {
public:
    const MWProcessSet& processes() const { return *_processes; }
    /// Depends on the order in which members were added; the grouping adds in one fixed order.
    uint64_t hashValue() const { return _hashValue; }
    // (the implementer completes: addProcess, isEqual, description, setters; MWProcessGroup with immutableCopy)

protected:
    std::shared_ptr<MWProcessSet> _processes = std::make_shared<MWProcessSet>();
    uint64_t _hashValue = 19;
};

#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "model/MWMemoryCategory.h"
#include "process/MWProcess.h"

class MWProcessGroup;

/// Processes in ascending order of pid, each pid once. Not owned: the analysis object owns its processes.
using MWProcessSet = std::vector<const MWProcess*>;

/// A growing set of processes, used while the sharers of each memory object are collected.
class MWProcessGroupMinimal {
public:
    MWProcessGroupMinimal() = default;
    virtual ~MWProcessGroupMinimal() = default;
    MWProcessGroupMinimal(MWProcessGroupMinimal&&) noexcept = default;
    MWProcessGroupMinimal& operator=(MWProcessGroupMinimal&&) noexcept = default;

    /// A process whose pid is already a member changes nothing. Costs least in ascending order of pid.
    virtual void addProcess(const MWProcess& process);
    /// An immutable group of the same members, which it shares with this one.
    std::shared_ptr<MWProcessGroup> immutableCopy() const;

    uint64_t hash() const { return _hashValue; }
    /// Whether both have the same members.
    virtual bool isEqual(const MWProcessGroupMinimal& other) const;
    /// "MWProcessGroup{MWProcess[PID], ...}"
    std::string description() const;

    const MWProcessSet& processes() const { return *_processes; }
    void setProcesses(std::shared_ptr<MWProcessSet> processes) { _processes = std::move(processes); }
    /// Depends on the order in which members were added; the grouping adds in one fixed order.
    uint64_t hashValue() const { return _hashValue; }
    void setHashValue(uint64_t hashValue) { _hashValue = hashValue; }

private:
    std::shared_ptr<MWProcessSet> _processes = std::make_shared<MWProcessSet>();
    uint64_t _hashValue = 19;
};

/// A fixed set of processes with the memory objects that exactly these processes map. Has an identity:
/// holders share the one object instead of copying it.
class MWProcessGroup : public MWProcessGroupMinimal {
public:
    using Objects = std::vector<std::shared_ptr<const MWMemoryObject>>;
    using Categories = std::shared_ptr<const MWCategoryTable>;

    MWProcessGroup() = default;
    MWProcessGroup(MWProcessGroup&&) = delete;
    MWProcessGroup& operator=(MWProcessGroup&&) = delete;
    ~MWProcessGroup() override = default;

    /// An invariant violation: the members are fixed.
    void addProcess(const MWProcess& process) override;
    void addObject(std::shared_ptr<const MWMemoryObject> object);

    /// Keeps the table for the next `refcount` (not 0) calls of consumeCachedCategories.
    void attachCachedCategories(Categories categories, uint32_t refcount);
    /// The kept table, none when there is none (any more).
    Categories consumeCachedCategories();

    /// Equal to a minimal group of the same members, which so finds its counterpart in a set of immutable
    /// groups; among immutable groups only to itself.
    bool isEqual(const MWProcessGroupMinimal& other) const override;

    /// Absent until the first addObject.
    const std::optional<Objects>& objects() const { return _objects; }
    void setObjects(std::optional<Objects> objects) { _objects = std::move(objects); }
    const Categories& categories() const { return _categories; }
    void setCategories(Categories categories) { _categories = std::move(categories); }
    uint32_t categoriesRefcount() const { return _categoriesRefcount; }
    void setCategoriesRefcount(uint32_t refcount) { _categoriesRefcount = refcount; }

private:
    uint32_t _categoriesRefcount = 0;
    std::optional<Objects> _objects;
    Categories _categories;
};

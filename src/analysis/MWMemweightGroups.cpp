#include <algorithm>
#include <set>
#include <unordered_map>
#include <unordered_set>

#include "analysis/FastBatchEnumeration.h"
#include "analysis/MWMemweight.h"

namespace {

constexpr size_t kRegionsPerSlice = 256;

using Group = std::shared_ptr<MWProcessGroup>;

struct GroupHash {
    using is_transparent = void;
    size_t operator()(const MWProcessGroupMinimal& group) const { return group.hash(); }
    size_t operator()(const Group& group) const { return group->hash(); }
};

struct GroupEqual {
    using is_transparent = void;
    bool operator()(const Group& group, const Group& other) const { return group->isEqual(*other); }
    bool operator()(const Group& group, const MWProcessGroupMinimal& other) const {
        return group->isEqual(other);
    }
    bool operator()(const MWProcessGroupMinimal& other, const Group& group) const {
        return group->isEqual(other);
    }
};

using GroupSet = std::unordered_set<Group, GroupHash, GroupEqual>;

struct Sharers {
    const MWMemoryObject* object;
    MWProcessGroupMinimal processes;
};

/// The sharer set of each object, in the order in which the objects are first met.
class SharerSets {
public:
    explicit SharerSets(std::set<int32_t> displayedPids) : _displayedPids(std::move(displayedPids)) {}

    void addRegion(const MWMemoryRegion& region, const MWProcess& process) {
        const MWMemoryObject* object = region.memoryObject();
        if (!process.hiddenFromDisplay() || _admitsHidden(*object)) {
            _sharersOf(object).addProcess(process);
        }
    }
    const std::vector<Sharers>& all() const { return _sharers; }

private:
    /// Whether the object is memory that a displayed process owns without mapping it.
    bool _admitsHidden(const MWMemoryObject& object) {
        if (object.ownerPid() == -1 || !_displayedPids.contains(object.ownerPid())) {
            return false;
        }
        // The search through the object's regions is made once, however many hidden processes map it.
        const auto [entry, isNew] = _containsFakeRegion.try_emplace(&object, false);
        if (isNew) {
            entry->second = object.containsFakeRegion();
        }
        return entry->second;
    }
    MWProcessGroupMinimal& _sharersOf(const MWMemoryObject* object) {
        const auto [entry, isNew] = _indexes.try_emplace(object, _sharers.size());
        if (isNew) {
            _sharers.push_back({object, {}});
        }
        return _sharers[entry->second].processes;
    }

    std::set<int32_t> _displayedPids;
    std::vector<Sharers> _sharers;
    std::unordered_map<const MWMemoryObject*, size_t> _indexes;
    std::unordered_map<const MWMemoryObject*, bool> _containsFakeRegion;
};

/// One group for each distinct sharer set, filled with its objects.
std::vector<Group> uniqueGroups(const SharerSets& sharerSets, size_t displayedCount) {
    constexpr size_t kGroupsPerProcess = 6;
    GroupSet groups(kGroupsPerProcess * displayedCount);
    for (const auto& [object, processes] : sharerSets.all()) {
        auto group = groups.find(processes);
        if (group == groups.end()) {
            group = groups.insert(processes.immutableCopy()).first;
        }
        (*group)->addObject(object->shared_from_this());
    }
    return {groups.begin(), groups.end()};
}

/// By number of members, then by their pids: the report must not depend on a hash table's order.
bool isReportedBefore(const Group& group, const Group& other) {
    const MWProcessSet& members = group->processes();
    const MWProcessSet& otherMembers = other->processes();
    if (members.size() != otherMembers.size()) {
        return members.size() < otherMembers.size();
    }
    return std::ranges::lexicographical_compare(members, otherMembers, {}, &MWProcess::pid, &MWProcess::pid);
}

}  // namespace

MWProcessToProcessGroups MWMemweight::_generateProcessToProcessGroups() const {
    std::set<int32_t> displayedPids;
    for (const MWProcess* process : _notHiddenProcesses()) {
        displayedPids.insert(process->pid());
    }
    SharerSets sharerSets(displayedPids);
    for (const auto& process : _processes) {
        mw_enumerateObjectsWithBatchSize(_regionsOf(*process), kRegionsPerSlice,
                                         [&](const std::shared_ptr<MWMemoryRegion>* regions, size_t count) {
                                             for (size_t i = 0; i < count; ++i) {
                                                 sharerSets.addRegion(*regions[i], *process);
                                             }
                                         });
    }
    std::vector<Group> groups = uniqueGroups(sharerSets, displayedPids.size());
    std::ranges::sort(groups, isReportedBefore);
    MWProcessToProcessGroups groupsOf;
    for (const Group& group : groups) {
        for (const MWProcess* process : group->processes()) {
            groupsOf[process->asNumber()].push_back(group);
        }
    }
    return groupsOf;
}

#include <algorithm>
#include <memory>
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

/// The processes that map one object: most objects have one, so a set is made for the second.
struct Sharers {
    const MWMemoryObject* object;
    const MWProcess* first;
    std::unique_ptr<MWProcessGroupMinimal> all = nullptr;

    void add(const MWProcess& process) {
        if (all == nullptr) {
            if (first->isEqual(process)) {
                return;
            }
            all = std::make_unique<MWProcessGroupMinimal>();
            all->addProcess(*first);
        }
        all->addProcess(process);
    }
};

/// The sharer set of each object, in the order in which the objects are first met.
class SharerSets {
public:
    SharerSets(std::set<int32_t> displayedPids, size_t objects)
        : _displayedPids(std::move(displayedPids)), _places(objects) {
        _sharers.reserve(objects);
    }

    void addRegion(const MWMemoryRegion& region, const MWProcess& process) {
        const MWMemoryObject* object = region.memoryObject();
        if (process.hiddenFromDisplay() && !_admitsHidden(*object)) {
            return;
        }
        uint32_t& place = _places[object->ordinal()];
        if (place == 0) {
            _sharers.push_back({.object = object, .first = &process});
            place = static_cast<uint32_t>(_sharers.size());
        } else {
            _sharers[place - 1].add(process);
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

    std::set<int32_t> _displayedPids;
    std::vector<Sharers> _sharers;
    std::vector<uint32_t> _places;  ///< by the object's ordinal, counted from 1; 0 for none
    std::unordered_map<const MWMemoryObject*, bool> _containsFakeRegion;
};

/// One group for each distinct sharer set, filled with its objects.
class UniqueGroups {
public:
    explicit UniqueGroups(size_t processes) : _groups(kGroupsPerProcess * processes) {}

    void add(const Sharers& sharers) { _groupOf(sharers)->addObject(sharers.object->shared_from_this()); }

    std::vector<Group> all() const {
        std::vector<Group> groups(_groups.begin(), _groups.end());
        for (const auto& [process, group] : _ofOne) {
            groups.push_back(group);
        }
        return groups;
    }

private:
    static constexpr size_t kGroupsPerProcess = 6;

    MWProcessGroup* _groupOf(const Sharers& sharers) {
        if (sharers.all == nullptr) {
            Group& group = _ofOne[sharers.first];
            if (group == nullptr) {
                MWProcessGroupMinimal one;
                one.addProcess(*sharers.first);
                group = one.immutableCopy();
            }
            return group.get();
        }
        auto found = _groups.find(*sharers.all);
        if (found == _groups.end()) {
            found = _groups.insert(sharers.all->immutableCopy()).first;
        }
        return found->get();
    }

    GroupSet _groups;  ///< of two or more
    std::unordered_map<const MWProcess*, Group> _ofOne;
};

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
    SharerSets sharerSets(displayedPids, _objectCount);
    for (const auto& process : _processes) {
        mw_enumerateObjectsWithBatchSize(_regionsOf(*process), kRegionsPerSlice,
                                         [&](const std::shared_ptr<MWMemoryRegion>* regions, size_t count) {
                                             for (size_t i = 0; i < count; ++i) {
                                                 sharerSets.addRegion(*regions[i], *process);
                                             }
                                         });
    }
    UniqueGroups unique(displayedPids.size());
    for (const Sharers& sharers : sharerSets.all()) {
        unique.add(sharers);
    }
    std::vector<Group> groups = unique.all();
    std::ranges::sort(groups, isReportedBefore);
    MWProcessToProcessGroups groupsOf;
    for (const Group& group : groups) {
        for (const MWProcess* process : group->processes()) {
            groupsOf[process->asNumber()].push_back(group);
        }
    }
    return groupsOf;
}

#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "model/MWMemoryRegion.h"
#include "model/MWRegionHolder.h"

using MWMemoryRegionList = std::vector<std::shared_ptr<MWMemoryRegion>>;
/// Regions by the pid of the process that maps them.
using MWProcessMemoryRegions = std::map<int32_t, MWMemoryRegionList>;

/// One piece of physical memory as the kernel manages it, with every region of every inspected process that
/// maps it. Open while regions are added, then finalized exactly once, then read-only. Compared by identity.
/// Always held by a shared_ptr. Adding to a finalized object, finalizing twice and copying an open object are
/// invariant violations.
class MWMemoryObject : public std::enable_shared_from_this<MWMemoryObject> {
public:
    // Sizes in bytes, valid once finalized.
    uint64_t totalDirtySize() const { return _totalDirtySize; }
    uint64_t totalCleanSize() const { return _totalCleanSize; }
    uint64_t totalSwappedSize() const { return _totalSwappedSize; }
    uint64_t totalReclaimableSize() const { return _totalReclaimableSize; }
    uint64_t totalWiredSize() const { return _totalWiredSize; }
    bool accurateSizes() const { return _accurateSizes; }

    /// The process that owns the memory exclusively, or -1.
    int32_t ownerPid() const { return _ownerPid; }
    void setOwnerPid(int32_t ownerPid) { _ownerPid = ownerPid; }
    /// The object's number in its analysis, in the order in which objects are met; 0 outside of one.
    uint32_t ordinal() const { return _ordinal; }
    void setOrdinal(uint32_t ordinal) { _ordinal = ordinal; }
    /// Every region added, in the order added.
    const MWMemoryRegionList& memoryRegions() const { return _memoryRegions; }
    /// The regions of each process that can have a view of its own; absent where no view differs.
    const MWProcessMemoryRegions* processMemoryRegions() const { return _processMemoryRegions.get(); }
    /// Merged page ranges of the counted regions; none for one region without sub-ranges, and none once
    /// finalized.
    const MWRangeList* rangeList() const { return _rangeList.get(); }

    /// `forProcess` must be present.
    void addRegion(const std::shared_ptr<MWMemoryRegion>& region, const MWRegionHolder* forProcess);
    /// A region of no process.
    void addRegion(const std::shared_ptr<MWMemoryRegion>& region, uint64_t pageSize);
    void finalize();
    /// True: the plain sums of the regions' own dirty and swapped sizes, overlaps included.
    void finalizeUsingRegionDirtySize(bool regionDirty);
    /// A finalized object with the same regions (shared); without reclaimable size and process map.
    std::shared_ptr<MWMemoryObject> copyWithZone() const;

    bool couldHaveProcessView() const;
    /// What `process` is charged of this object: this object itself, or a new finalized one.
    std::shared_ptr<const MWMemoryObject> viewForProcess(const MWRegionHolder& process) const;
    bool containsFakeRegion() const;
    /// The region whose names stand for the object. The object has at least one region.
    const MWMemoryRegion& _canonicalRegion() const;
    const std::string& name() const { return _canonicalRegion().name(); }
    std::optional<std::string> detailedName() const { return _canonicalRegion().detailedName(); }
    std::string fullName() const { return _canonicalRegion().fullName(); }
    bool verbose() const { return _memoryRegions.front()->verbose(); }

private:
    void _addRegion(const std::shared_ptr<MWMemoryRegion>& region, uint64_t pageSize,
                    const MWRegionHolder* forProcess);
    void _count(MWMemoryRegion& region, uint64_t pageSize);
    void _makeRangeList();
    MWCategoryTotals _mergedTotals() const;
    void _raiseToLargestProcess();
    bool _everyProcessSeesWholeObject() const;
    void _nameFakeRegions();
    std::shared_ptr<const MWMemoryObject> _viewOfRegions(const MWMemoryRegionList& regions,
                                                         const MWRegionHolder& process) const;

    uint64_t _totalDirtySize = 0;
    uint64_t _totalCleanSize = 0;
    uint64_t _totalSwappedSize = 0;
    uint64_t _totalReclaimableSize = 0;
    bool _accurateSizes = false;
    int32_t _ownerPid = -1;
    uint32_t _ordinal = 0;
    uint64_t _totalWiredSize = 0;
    MWMemoryRegionList _memoryRegions;
    std::unique_ptr<MWProcessMemoryRegions> _processMemoryRegions;
    std::unique_ptr<MWRangeList> _rangeList;
    /// The only counted region so far, where it needs no list of ranges: most objects have no other.
    const MWMemoryRegion* _onlyCounted = nullptr;
    uint64_t _onlyCountedPageSize = 0;
};

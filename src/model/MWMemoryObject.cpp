#include "model/MWMemoryObject.h"

#include <algorithm>

#include "platform/MWInvariant.h"
#include "platform/MWPhysMemweightSwitch.h"

namespace {

struct RegionSums {
    uint64_t dirty = 0;
    uint64_t swapped = 0;
};

/// What the regions hold each by itself, pages that several of them map counted several times.
RegionSums plainSums(const MWMemoryRegionList& regions) {
    RegionSums sums;
    for (const auto& region : regions) {
        sums.dirty += region->dirtySize();
        sums.swapped += region->swappedSize();
    }
    return sums;
}

}  // namespace

void MWMemoryObject::addRegion(const std::shared_ptr<MWMemoryRegion>& region,
                               const MWRegionHolder* forProcess) {
    MW_INVARIANT(forProcess != nullptr, "A region is added for a process, and there is none.");
    _addRegion(region, forProcess->pageSize(), forProcess);
}

void MWMemoryObject::addRegion(const std::shared_ptr<MWMemoryRegion>& region, uint64_t pageSize) {
    _addRegion(region, pageSize, nullptr);
}

void MWMemoryObject::_addRegion(const std::shared_ptr<MWMemoryRegion>& region, uint64_t pageSize,
                                const MWRegionHolder* forProcess) {
    MW_INVARIANT(!_accurateSizes, "A finalized memory object takes no more regions.");
    _memoryRegions.push_back(region);
    if (region->object_id() == 0) {
        return;
    }
    if (forProcess != nullptr && (_processMemoryRegions || region->eligibleForProcessView())) {
        if (_processMemoryRegions == nullptr) {
            _processMemoryRegions = std::make_unique<MWProcessMemoryRegions>();
        }
        (*_processMemoryRegions)[forProcess->pid()].push_back(region);
    }
    _count(*region, pageSize);
}

void MWMemoryObject::_count(MWMemoryRegion& region, uint64_t pageSize) {
    if (_rangeList == nullptr && _onlyCounted == nullptr && region.subrangeList() == nullptr) {
        _onlyCounted = &region;
        _onlyCountedPageSize = pageSize;
        return;
    }
    _makeRangeList();
    _rangeList->addRegion(region, pageSize);
    region.freeSubrangeList();
}

void MWMemoryObject::_makeRangeList() {
    if (_rangeList == nullptr) {
        _rangeList = std::make_unique<MWRangeList>();
        if (_onlyCounted != nullptr) {
            _rangeList->addRegion(*_onlyCounted, _onlyCountedPageSize);
        }
    }
}

MWCategoryTotals MWMemoryObject::_mergedTotals() const {
    if (_rangeList != nullptr) {
        return _rangeList->sum();
    }
    return _onlyCounted == nullptr ? MWCategoryTotals{} : _onlyCounted->totals();
}

void MWMemoryObject::finalize() {
    finalizeUsingRegionDirtySize(false);
}

void MWMemoryObject::finalizeUsingRegionDirtySize(bool regionDirty) {
    MW_INVARIANT(!_accurateSizes, "A memory object is finalized only once.");
    const MWCategoryTotals merged = _mergedTotals();
    if (regionDirty) {
        const RegionSums sums = plainSums(_memoryRegions);
        _totalDirtySize += sums.dirty;
        _totalSwappedSize += sums.swapped;
    } else {
        _totalDirtySize = merged.dirty;
        _totalSwappedSize = merged.swapped;
        _raiseToLargestProcess();
    }
    _totalCleanSize = merged.clean;
    _totalReclaimableSize = merged.reclaimable;
    _totalWiredSize = merged.wired;
    _rangeList.reset();
    _onlyCounted = nullptr;
    if (_processMemoryRegions && (_processMemoryRegions->size() < 2 || _everyProcessSeesWholeObject())) {
        _processMemoryRegions.reset();
    }
    _nameFakeRegions();
    _accurateSizes = true;
}

/// Where processes are charged their regions' own sizes, the whole object holds at least what any one of its
/// processes is charged.
void MWMemoryObject::_raiseToLargestProcess() {
    if (!_processMemoryRegions || !MWPhysMemweightSwitch::isOn()) {
        return;
    }
    for (const auto& [pid, regions] : *_processMemoryRegions) {
        const RegionSums sums = plainSums(regions);
        _totalDirtySize = std::max(_totalDirtySize, sums.dirty);
        _totalSwappedSize = std::max(_totalSwappedSize, sums.swapped);
    }
}

bool MWMemoryObject::_everyProcessSeesWholeObject() const {
    return std::ranges::all_of(*_processMemoryRegions, [this](const auto& entry) {
        const MWMemoryRegionList& regions = entry.second;
        if (regions.size() != 1) {
            return false;
        }
        const MWMemoryRegion& region = *regions.front();
        return region.dirtySize() == _totalDirtySize && region.swappedSize() == _totalSwappedSize &&
               region.cleanNonSpecSize() == _totalCleanSize &&
               region.reclaimableSize() == _totalReclaimableSize && region.wiredSize() == _totalWiredSize;
    });
}

/// Owned memory that its process does not map shows under the name of a real mapping of the same object.
void MWMemoryObject::_nameFakeRegions() {
    if (!containsFakeRegion()) {
        return;
    }
    const MWMemoryRegion& canonical = _canonicalRegion();
    if (canonical.isFake()) {
        return;
    }
    for (const auto& region : _memoryRegions) {
        if (region->isFake()) {
            region->setName(canonical.name());
            region->setDetailedName(canonical.detailedName());
        }
    }
}

std::shared_ptr<MWMemoryObject> MWMemoryObject::copyWithZone() const {
    MW_INVARIANT(_accurateSizes && _rangeList == nullptr, "Only a finalized memory object is copied.");
    auto copy = std::make_shared<MWMemoryObject>();
    copy->_totalDirtySize = _totalDirtySize;
    copy->_totalSwappedSize = _totalSwappedSize;
    copy->_totalCleanSize = _totalCleanSize;
    copy->_totalWiredSize = _totalWiredSize;
    copy->_memoryRegions = _memoryRegions;
    copy->_accurateSizes = _accurateSizes;
    copy->_ownerPid = _ownerPid;
    return copy;
}

bool MWMemoryObject::couldHaveProcessView() const {
    return (_processMemoryRegions && !_processMemoryRegions->empty()) || _ownerPid != -1;
}

std::shared_ptr<const MWMemoryObject> MWMemoryObject::viewForProcess(const MWRegionHolder& process) const {
    std::shared_ptr<const MWMemoryObject> view = shared_from_this();
    if (_processMemoryRegions && !_processMemoryRegions->empty()) {
        const auto own = _processMemoryRegions->find(process.pid());
        if (own == _processMemoryRegions->end()) {
            return view;
        }
        view = _viewOfRegions(own->second, process);
    }
    if (_ownerPid == -1 || _ownerPid == process.pid()) {
        return view;
    }
    // The owner pays: to everybody else its dirty and swapped pages are clean.
    auto charged = view->copyWithZone();
    charged->_totalDirtySize = 0;
    charged->_totalSwappedSize = 0;
    charged->_totalCleanSize = view->_totalCleanSize + _totalDirtySize + _totalSwappedSize;
    return charged;
}

std::shared_ptr<const MWMemoryObject> MWMemoryObject::_viewOfRegions(const MWMemoryRegionList& regions,
                                                                     const MWRegionHolder& process) const {
    auto view = std::make_shared<MWMemoryObject>();
    view->setOwnerPid(_ownerPid);
    view->_memoryRegions.reserve(regions.size());
    for (const auto& region : regions) {
        view->addRegion(region, process.pageSize());
    }
    view->finalizeUsingRegionDirtySize(process.breakDownPhysMemweight());
    return view;
}

bool MWMemoryObject::containsFakeRegion() const {
    return std::ranges::any_of(_memoryRegions, [](const auto& region) { return region->isFake(); });
}

const MWMemoryRegion& MWMemoryObject::_canonicalRegion() const {
    const MWMemoryRegion& first = *_memoryRegions.front();
    if (!first.inSharedCache() && _ownerPid == -1) {
        return first;
    }
    const auto namesTheObject = [&first](const auto& region) {
        return first.inSharedCache() ? !region->unusedSharedCacheRegion() : !region->isFake();
    };
    const auto found = std::ranges::find_if(_memoryRegions, namesTheObject);
    return found == _memoryRegions.end() ? first : **found;
}

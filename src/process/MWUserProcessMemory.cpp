#include <fmt/core.h>

#include <algorithm>

#include "platform/MWRegionTags.h"
#include "platform/MWSizeMath.h"
#include "process/MWUserProcess.h"

namespace {

/// Spans that a platform reserves without using them.
struct ReservedSpan {
    uint64_t address;
    uint64_t size;
    const char* name;
};
constexpr std::array<ReservedSpan, 2> kReservedSpans = {{
    {0xFC0000000, 0x40000000, "commpage (reserved)"},
    {0x1000000000, 0x6000000000, "GPU Carveout (reserved)"},
}};

const char* reservedSpanName(const MWWalkedRegion& walked) {
    for (const ReservedSpan& span : kReservedSpans) {
        if (walked.address == span.address && walked.size == span.size) {
            return span.name;
        }
    }
    return nullptr;
}

bool isVolatileOrEmpty(int32_t purgeState) {
    return purgeState == VM_PURGABLE_VOLATILE || purgeState == VM_PURGABLE_EMPTY;
}

struct OwnedCharge {
    uint64_t dirty;
    uint64_t swapped;
};

OwnedCharge chargeOf(const OwnedObjectRecord& object) {
    if (object.notCharged()) {
        return {.dirty = 0, .swapped = 0};
    }
    const bool purgeable =
        object.purgeState() == VM_PURGABLE_VOLATILE || object.purgeState() == VM_PURGABLE_EMPTY;
    if (purgeable) {
        return {.dirty = object.wired, .swapped = 0};
    }
    return {.dirty = MWSaturatingSubtract(object.resident, object.reusable), .swapped = object.compressed};
}

MWSharedText mappedFileName() {
    static const auto& name = *new std::string("mapped file");
    return MWUncountedText(name);
}

/// The category name, with the ledger that the object is charged to.
std::string ownedObjectName(uint32_t tag, const OwnedObjectRecord& object) {
    std::string category = MWMemoryRegion::categoryNameForTag(tag);
    const auto ledger = MWMemoryRegion::vmLedgerNameForTag(object.ledgerTag());
    return ledger ? fmt::format("{} ({})", category, *ledger) : category;
}

std::shared_ptr<MWMemoryRegion> leftoverOwnedObject(const OwnedObjectRecord& object) {
    const OwnedCharge charge = chargeOf(object);
    auto region = std::make_shared<MWMemoryRegion>();
    region->setObject_id(object.object_id);
    region->setOwnedExclusivelyByParentProcess(true);
    region->setUser_tag(MWFakeRegionTag);
    region->setName(ownedObjectName(MWFakeRegionTag, object));
    region->setSize(object.virtual_size);
    region->setReclaimableSize(object.reusable);
    region->setStart(MWNoAddress);
    region->setShare_mode(SM_SHARED);
    region->setSwappedSize(charge.swapped);
    region->setDirtySize(charge.dirty);
    region->setWired(object.wired != 0);
    return region;
}

std::shared_ptr<MWMemoryRegion> pageTableRegion(uint64_t bytes) {
    auto region = std::make_shared<MWMemoryRegion>();
    region->setSize(bytes);
    region->setDirtySize(bytes);
    region->setStart(MWNoAddress);
    region->setName("page table");
    region->setObject_id(UINT64_MAX);
    region->setShare_mode(SM_PRIVATE);
    return region;
}

std::shared_ptr<MWMemoryRegion> regionOfRecord(const MWWalkedRegion& walked) {
    auto region = std::make_shared<MWMemoryRegion>();
    region->setStart(walked.address);
    region->setSize(walked.size);
    region->setUser_tag(walked.info.user_tag);
    region->setObject_id(walked.info.object_id_full);
    region->setShare_mode(walked.info.share_mode);
    region->setOffset(walked.info.offset);
    region->setWired(walked.info.user_wired_count != 0);
    return region;
}

/// Takes as much of `amount` out of `from` as there is, and answers what is left of `amount`.
uint64_t takeOut(uint64_t amount, uint64_t& from) {
    const uint64_t taken = std::min(amount, from);
    from -= taken;
    return amount - taken;
}

}  // namespace

/// The state of one walk. `holder` is the kernel's one figure for all memory that the process owns without
/// mapping it; the kernel counts in it what mapped regions turn out to be charged for (`ownedCharge`, bytes),
/// so that is taken out again in the end.
struct MWUserProcess::MemoryGathering {
    MWImageEnumerator images;
    bool hidden;
    bool breakDown;
    MWMemoryRegionList regions = {};
    std::shared_ptr<MWMemoryRegion> holder = {};
    uint64_t ownedCharge = 0;
    // Texts that further regions have as well.
    std::vector<std::pair<uint32_t, MWSharedText>> categoryNames = {};
    MWSharedText lastPath = {};

    const MWSharedText& categoryName(uint32_t tag) {
        const auto known = std::ranges::find(categoryNames, tag, &std::pair<uint32_t, MWSharedText>::first);
        if (known != categoryNames.end()) {
            return known->second;
        }
        const auto name = std::make_shared<const std::string>(MWMemoryRegion::categoryNameForTag(tag));
        return categoryNames.emplace_back(tag, name).second;
    }
    const MWSharedText& pathText(const std::string& path) {
        if (lastPath == nullptr || *lastPath != path) {
            lastPath = std::make_shared<const std::string>(path);
        }
        return lastPath;
    }
};

void MWUserProcess::_gatherMemoryData() {
    MemoryGathering gathering = {.images = MWImageEnumerator(_images),
                                 .hidden = hiddenFromDisplay(),
                                 .breakDown = breakDownPhysMemweight()};
    enumerateRegions([&](const MWWalkedRegion& walked) { return _classifyRegion(gathering, walked); });
    _addTaskWarnings();
    _pendingUnusedSharedRegion.reset();
    _appendLeftoverOwnedObjects(gathering.regions);
    _settleHolder(gathering);
    if (gathering.breakDown && _ledgers[0] != 0) {
        gathering.regions.push_back(pageTableRegion(_ledgers[0]));
    }
    setMemoryRegions(std::move(gathering.regions));
}

bool MWUserProcess::_classifyRegion(MemoryGathering& gathering, const MWWalkedRegion& walked) {
    if (_isInSharedCache(walked.address)) {
        return _classifySharedCacheMapping(gathering, walked);
    }
    const auto region = regionOfRecord(walked);
    _setSizes(*region, walked, gathering.breakDown);
    const bool isHolder = region->isFake() && !isVolatileOrEmpty(walked.purgeState);
    if (isHolder) {
        if (_ownedVmObjects) {
            // The owned objects describe the same memory one by one.
            return false;
        }
        if (walked.info.object_id_full == 0) {
            region->setObject_id(walked.info.object_id);
        }
        gathering.holder = region;
    }
    _nameRegion(gathering, *region, walked);
    if (gathering.breakDown && !gathering.hidden && region->eligibleForSubrangesUsingPageSize(pageSize())) {
        _addSubrangesForRegion(*region, walked.purgeState);
    }
    if (!isHolder) {
        gathering.regions.push_back(region);
    }
    return false;
}

bool MWUserProcess::_classifySharedCacheMapping(MemoryGathering& gathering, const MWWalkedRegion& walked) {
    if (gathering.hidden) {
        return false;
    }
    const bool split =
        _addRegionsToArray(gathering.regions, {.forRegionInSharedRegionStartingAt = walked.address,
                                               .withSize = walked.size,
                                               .withRegionInfo = walked.info,
                                               .imageEnumerator = gathering.images});
    if (!split) {
        _printBailingOut();
    }
    return !split;
}

// Page counts of one record are read at different moments by the kernel and need not add up: differences stop
// at 0.
void MWUserProcess::_setSizes(MWMemoryRegion& region, const MWWalkedRegion& walked, bool breakDown) const {
    const vm_region_submap_info_64& info = walked.info;
    const auto bytes = [this](uint64_t pages) { return MWSaturatingMultiply(pages, pageSize()); };
    if (walked.purgeState == VM_PURGABLE_EMPTY) {
        region.setReclaimableSize(walked.size);
        return;
    }
    if (walked.purgeState == VM_PURGABLE_VOLATILE) {
        region.setReclaimableSize(bytes(info.pages_resident));
        return;
    }
    const uint64_t inUsePages = MWSaturatingSubtract(info.pages_resident, info.pages_reusable);
    const uint64_t dirtyPages = info.external_pager != 0 || breakDown ? info.pages_dirtied : inUsePages;
    region.setDirtySize(bytes(dirtyPages));
    region.setReclaimableSize(bytes(info.pages_reusable));
    region.setSwappedSize(bytes(info.pages_swapped_out));
    region.setCleanNonSpecSize(bytes(MWSaturatingSubtract(inUsePages, dirtyPages)));
}

void MWUserProcess::_nameRegion(MemoryGathering& gathering, MWMemoryRegion& region,
                                const MWWalkedRegion& walked) {
    const MWImage* image =
        gathering.images.nextImageForStart(walked.address, {.end = walked.address + walked.size});
    const char* reservedName = reservedSpanName(walked);
    region.setSegment(SegmentNotImage);
    region.setVerbose(walked.verbose);
    if (image != nullptr) {
        region.setName(image->name());
        region.setDetailedName(image->ownerPath());
        region.setSegment(image->segment());
    } else if (walked.name) {
        region.setName(*walked.name);
    } else if (walked.path || walked.info.external_pager != 0) {
        region.setName(mappedFileName());
        region.setDetailedName(walked.path ? gathering.pathText(*walked.path) : nullptr);
    } else if (reservedName != nullptr) {
        region.setName(reservedName);
        region.setVerbose(true);
    } else {
        region.setName(gathering.categoryName(walked.info.user_tag));
        if (gathering.breakDown) {
            _matchOwnedObject(gathering, region, walked);
        }
    }
}

void MWUserProcess::_matchOwnedObject(MemoryGathering& gathering, MWMemoryRegion& region,
                                      const MWWalkedRegion& walked) {
    OwnedCharge charge = {};
    if (!_ownedVmObjects) {
        // Without the list, memory that takes part in purging is taken to be owned.
        if (walked.purgeState == VM_PURGABLE_DENY || walked.info.user_tag == MWTagLoader ||
            walked.info.pages_resident == 0) {
            return;
        }
        charge = {.dirty = MWSaturatingAdd(region.dirtySize(), region.cleanNonSpecSize()), .swapped = 0};
    } else {
        const auto entry = _ownedVmObjects->extract(walked.info.object_id_full);
        if (entry.empty()) {
            return;
        }
        const OwnedObjectRecord& object = entry.mapped();
        charge = chargeOf(object);
        region.setReclaimableSize(object.reusable);
        region.setName(ownedObjectName(walked.info.user_tag, object));
    }
    region.setOwnedExclusivelyByParentProcess(true);
    region.setDirtySize(charge.dirty);
    region.setCleanNonSpecSize(0);
    region.setSwappedSize(charge.swapped);
    gathering.ownedCharge =
        MWSaturatingAdd(gathering.ownedCharge, MWSaturatingAdd(charge.dirty, charge.swapped));
}

void MWUserProcess::_appendLeftoverOwnedObjects(MWMemoryRegionList& regions) {
    if (_ownedVmObjects) {
        for (const auto& [identifier, object] : *_ownedVmObjects) {
            regions.push_back(leftoverOwnedObject(object));
        }
        _ownedVmObjects.reset();
    }
}

void MWUserProcess::_settleHolder(MemoryGathering& gathering) {
    if (gathering.holder == nullptr) {
        return;
    }
    MWMemoryRegion& holder = *gathering.holder;
    uint64_t dirty = holder.dirtySize();
    uint64_t swapped = holder.swappedSize();
    const uint64_t excess = takeOut(takeOut(gathering.ownedCharge, dirty), swapped);
    holder.setDirtySize(dirty);
    holder.setSwappedSize(swapped);
    if (excess != 0) {
        _addWarning(
            fmt::format("{}: Memweight changed while analyzing – unmapped owned physical memweight may be "
                        "over-counted by {} bytes",
                        displayString(), excess));
    }
    if (dirty != 0 || swapped != 0) {
        holder.setStart(MWNoAddress);
        gathering.regions.push_back(gathering.holder);
    }
}

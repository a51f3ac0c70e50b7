#include <fmt/core.h>

#include <algorithm>
#include <array>
#include <cstdio>

#include "platform/MWHostInterface.h"
#include "process/MWUserProcess.h"

namespace {

constexpr uint64_t kBoundaryPrecision = 0x1000000;
/// Twice what halving 64 bits down to one takes. Only a map that contradicts itself needs more.
constexpr int kMostBoundaryQueries = 128;
constexpr size_t kPathBytes = 1024;

/// What a shared-cache mapping is known to be without asking for every one of its submap's entries. All
/// processes map the same cache, hence one object for all of it.
vm_region_submap_info_64 sharedMappingRecord(const vm_region_basic_info_64& basic) {
    vm_region_submap_info_64 info;
    info.protection = basic.protection;
    info.max_protection = basic.max_protection;
    info.inheritance = basic.inheritance;
    info.offset = basic.offset;
    info.behavior = basic.behavior;
    info.user_wired_count = basic.user_wired_count;
    info.is_submap = basic.reserved;
    info.external_pager = 1;
    info.share_mode = SM_COW;
    info.object_id = 1;
    info.object_id_full = 1;
    return info;
}

}  // namespace

bool MWUserProcess::_setSharedRegionFromPlatform(int platformCode) {
    struct Place {
        uint64_t base;
        uint64_t size;
    };
    static constexpr std::array<Place, 5> places = {{
        {0x90000000, 0x20000000},
        {0x7FFF00000000, 0xFFE00000},
        {0x40000000, 0x40000000},
        {0x180000000, 0x100000000},
        {0x1A000000, 0x40000000},
    }};
    if (platformCode == MWPlatformUnknown) {
        std::fputs("Unable to determine platform architecture of target\n", stderr);
        return false;
    }
    if (platformCode < MWPlatformUnknown) {
        const Place& place = places.at(static_cast<size_t>(platformCode));
        _sharedRegionBase = place.base;
        _sharedRegionSize = place.size;
    }
    return true;
}

// Halves [low, high], keeping the start of a region below the cache in `low` and an address from which on
// there is nothing before the cache in `high`.
uint64_t MWUserProcess::_lastNonSharedCacheRegion() {
    if (_sharedRegionSize == 0) {
        return 0;
    }
    MWHostInterface& host = MWHostInterface::current();
    uint64_t low = 0;
    uint64_t high = _sharedRegionBase;
    int queries = 0;
    do {
        const uint64_t middle = low / 2 + high / 2;
        uint64_t start = middle;
        uint64_t size = 0;
        vm_region_basic_info_64 info;
        uint32_t words = VM_REGION_BASIC_INFO_COUNT_64;
        if (host.mach_vm_region(*_task, start, size, info, words) != KERN_SUCCESS || start == low) {
            break;
        }
        if (start < _sharedRegionBase) {
            low = start;
        } else {
            high = middle - pageSize();
        }
    } while (high > low && high - low > kBoundaryPrecision && ++queries < kMostBoundaryQueries);
    return low;
}

void MWUserProcess::enumerateRegions(const MWRegionCallback& callback) {
    const uint64_t boundary = _lastNonSharedCacheRegion();
    bool fakeRegionSeen = false;
    uint64_t address = 0;
    while (true) {
        MWWalkedRegion region = {.address = address};
        const WalkStep step = _nextRegion(boundary, region);
        const bool isFake = region.info.user_tag == MWFakeRegionTag;
        // Owned memory without an address is reported behind the last real region, and nothing counts after
        // it.
        if (step == WalkStep::end || (step == WalkStep::region && fakeRegionSeen && !isFake) ||
            !_leadsOnFrom(address, region)) {
            return;
        }
        address = region.address + region.size;
        fakeRegionSeen = fakeRegionSeen || isFake;
        if (step == WalkStep::region) {
            if (region.info.is_submap != 0) {
                // Never seen when asked for at any depth; its parts would be reported on their own.
                continue;
            }
            _gatherRegionDetails(region);
        }
        if (callback(region)) {
            return;
        }
    }
}

MWUserProcess::WalkStep MWUserProcess::_nextRegion(uint64_t boundary, MWWalkedRegion& region) {
    const uint64_t sharedRegionEnd = _sharedRegionBase + _sharedRegionSize;
    if (boundary != 0 && region.address >= boundary && region.address < sharedRegionEnd) {
        const WalkStep step = _querySharedMapping(boundary, region);
        if (step != WalkStep::notShared) {
            return step;
        }
    }
    return _queryRecursively(region);
}

MWUserProcess::WalkStep MWUserProcess::_querySharedMapping(uint64_t boundary, MWWalkedRegion& region) {
    uint64_t start = region.address;
    vm_region_basic_info_64 basic;
    uint32_t words = VM_REGION_BASIC_INFO_COUNT_64;
    const kern_return_t result =
        MWHostInterface::current().mach_vm_region(*_task, start, region.size, basic, words);
    if (result != KERN_SUCCESS) {
        return _endWalk(result, "mach_vm_region");
    }
    region.address = std::max(region.address, start);
    if (region.address < boundary || !_isInSharedCache(region.address)) {
        return WalkStep::notShared;
    }
    region.info = sharedMappingRecord(basic);
    return WalkStep::sharedMapping;
}

MWUserProcess::WalkStep MWUserProcess::_queryRecursively(MWWalkedRegion& region) {
    uint32_t depth = UINT32_MAX;
    uint32_t words = VM_REGION_SUBMAP_INFO_COUNT_64;
    const kern_return_t result = MWHostInterface::current().mach_vm_region_recurse(
        *_task, region.address, region.size, depth, region.info, words);
    if (result != KERN_SUCCESS) {
        return _endWalk(result, "mach_vm_region_recurse");
    }
    if (words < VM_REGION_SUBMAP_INFO_COUNT_64) {
        region.info.object_id_full = region.info.object_id;
    }
    return WalkStep::region;
}

MWUserProcess::WalkStep MWUserProcess::_endWalk(kern_return_t result, std::string_view label) {
    if (result != KERN_INVALID_ADDRESS) {
        MWHostInterface::current().mach_error(label, result);
        _printBailingOut();
        _processMachVMError(result, {.expectingErrorOnExit = MACH_SEND_INVALID_DEST});
    }
    return WalkStep::end;
}

// A region that is empty, wraps around the address space or ends where the walk has already been would keep
// the walk going for ever.
bool MWUserProcess::_leadsOnFrom(uint64_t address, const MWWalkedRegion& region) {
    const bool wraps = region.size > UINT64_MAX - region.address;
    if (!wraps && region.size != 0 && region.address + region.size > address) {
        return true;
    }
    _printBailingOut();
    _addError(fmt::format("{}: malformed region at {:#x} of {:#x} bytes", displayString(), region.address,
                          region.size));
    return false;
}

void MWUserProcess::_gatherRegionDetails(MWWalkedRegion& region) const {
    MWHostInterface& host = MWHostInterface::current();
    if (host.mach_vm_purgable_control(*_task, region.address, VM_PURGABLE_GET_STATE, region.purgeState) !=
        KERN_SUCCESS) {
        region.purgeState = VM_PURGABLE_DENY;
    }
    if (region.info.external_pager == 0 || !_isAlive()) {
        return;
    }
    std::array<char, kPathBytes> path;
    const int length = host.proc_regionfilename(pid(), region.address, path);
    if (length > 0) {
        region.path.emplace(path.data(), std::min(path.size(), static_cast<size_t>(length)));
    }
}

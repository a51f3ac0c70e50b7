#include "analysis/MWMemoryObjectMaps.h"

#include <algorithm>
#include <bit>
#include <utility>

namespace {

constexpr size_t kObjectsPerProcess = 100;
constexpr size_t kImageObjectsPerProcess = 2;
constexpr size_t kTranslatedSharedCacheObjects = 512;

/// The part of the slots that may be used.
constexpr struct {
    size_t numerator = 3;
    size_t denominator = 4;
} kMostUsed;

uint64_t sharedCacheKey(const MWMemoryRegion& region, const MWProcess& process) {
    const bool written = region.dirtySize() != 0 || region.swappedSize() != 0;
    if (region.segment() != SegmentData || !written) {
        return region.start();
    }
    // A process that wrote to the data pages of the cache has a copy of its own of them.
    return region.start() ^ (uint64_t{static_cast<uint32_t>(process.pid())} << 32);
}

uint64_t keyForRegion(const MWMemoryRegion& region, const MWProcess& process) {
    return region.inSharedCache() ? sharedCacheKey(region, process) : region.object_id();
}

}  // namespace

MWMemoryObjectMap::MWMemoryObjectMap(size_t expectedKeys) {
    _resize(expectedKeys);
}

MWMemoryObject*& MWMemoryObjectMap::operator[](uint64_t key) {
    Slot* slot = &_slotOfKey(key);
    if (slot->key == 0) {
        if (++_keys * kMostUsed.denominator > _slots.size() * kMostUsed.numerator) {
            _resize(2 * _keys);
            slot = &_slotOfKey(key);
        }
        slot->key = key;
    }
    return slot->object;
}

/// The one that has the key, or the free one for it.
MWMemoryObjectMap::Slot& MWMemoryObjectMap::_slotOfKey(uint64_t key) {
    // The low bits of identifiers and addresses say little; the high bits of the product depend on all
    // others.
    constexpr uint64_t kGoldenRatio = 0x9E3779B97F4A7C15;
    const uint64_t hash = key >> 8U;
    const size_t mask = _slots.size() - 1;
    size_t place = static_cast<size_t>((hash * kGoldenRatio) >> 32U) & mask;
    while (_slots[place].key != 0 && _slots[place].key != key) {
        place = (place + 1) & mask;
    }
    return _slots[place];
}

void MWMemoryObjectMap::_resize(size_t keys) {
    constexpr size_t kFewest = 8;
    const size_t needed = keys * kMostUsed.denominator / kMostUsed.numerator + 1;
    const auto before = std::exchange(_slots, std::vector<Slot>(std::bit_ceil(std::max(needed, kFewest))));
    for (const Slot& slot : before) {
        if (slot.key != 0) {
            _slotOfKey(slot.key) = slot;
        }
    }
}

MWMemoryObjectMaps::MWMemoryObjectMaps(size_t processCount, size_t regionCount)
    : _memoryObjects(std::min(kObjectsPerProcess * processCount, regionCount)),
      _sharedCacheTranslatedMemoryObjects(kTranslatedSharedCacheObjects),
      _textMemoryObjects(kImageObjectsPerProcess * processCount),
      _linkeditMemoryObjects(kImageObjectsPerProcess * processCount) {
    _objects.reserve(regionCount);
}

MWMemoryObject& MWMemoryObjectMaps::objectForRegion(const MWMemoryRegion& region, const MWProcess& process) {
    const uint64_t key = keyForRegion(region, process);
    if (key == 0 || key == UINT64_MAX) {
        return _addObject();
    }
    MWMemoryObject*& object = _mapForRegion(region, process)[key];
    if (object == nullptr) {
        object = &_addObject();
    }
    return *object;
}

MWMemoryObjectMap& MWMemoryObjectMaps::_mapForRegion(const MWMemoryRegion& region, const MWProcess& process) {
    if (region.inSharedCache()) {
        return process.isTranslated() ? _sharedCacheTranslatedMemoryObjects : _sharedCacheMemoryObjects;
    }
    switch (region.segment()) {
        case SegmentText:
            return _textMemoryObjects;
        case SegmentLinkedit:
            return _linkeditMemoryObjects;
        default:
            return _memoryObjects;
    }
}

MWMemoryObject& MWMemoryObjectMaps::_addObject() {
    MWMemoryObject& object = *_objects.emplace_back(std::make_shared<MWMemoryObject>());
    object.setOrdinal(static_cast<uint32_t>(_objects.size() - 1));
    return object;
}

#include "analysis/MWMemoryObjectMaps.h"

#include <algorithm>

namespace {

constexpr size_t kObjectsPerProcess = 100;
constexpr size_t kImageObjectsPerProcess = 2;
constexpr size_t kTranslatedSharedCacheObjects = 512;

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

MWMemoryObjectMaps::MWMemoryObjectMaps(size_t processCount, size_t regionCount)
    : _memoryObjects(std::min(kObjectsPerProcess * processCount, regionCount)),
      _sharedCacheTranslatedMemoryObjects(kTranslatedSharedCacheObjects),
      _textMemoryObjects(kImageObjectsPerProcess * processCount),
      _linkeditMemoryObjects(kImageObjectsPerProcess * processCount) {}

MWMemoryObject& MWMemoryObjectMaps::objectForRegion(const MWMemoryRegion& region, const MWProcess& process) {
    const uint64_t key = keyForRegion(region, process);
    if (key == 0 || key == UINT64_MAX) {
        return _addUniqueObject();
    }
    std::shared_ptr<MWMemoryObject>& object = _mapForRegion(region, process)[key];
    if (!object) {
        object = _makeObject();
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

MWMemoryObject& MWMemoryObjectMaps::_addUniqueObject() {
    return *_uniqueMemoryObjects.emplace_back(_makeObject());
}

std::shared_ptr<MWMemoryObject> MWMemoryObjectMaps::_makeObject() {
    auto object = std::make_shared<MWMemoryObject>();
    object->setOrdinal(_objectCount++);
    return object;
}

void MWMemoryObjectMaps::forEachObject(const std::function<void(MWMemoryObject&)>& block) const {
    const auto walk = [&](const MWMemoryObjectMap& map) {
        for (const auto& [key, object] : map) {
            block(*object);
        }
    };
    walk(_memoryObjects);
    walk(_sharedCacheMemoryObjects);
    walk(_sharedCacheTranslatedMemoryObjects);
    for (const auto& object : _uniqueMemoryObjects) {
        block(*object);
    }
    walk(_textMemoryObjects);
    walk(_linkeditMemoryObjects);
}

#include "analysis/MWMemoryObjectMaps.h"

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

MWMemoryObjectMaps::MWMemoryObjectMaps(size_t processCount)
    : _memoryObjects(kObjectsPerProcess * processCount),
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
        object = std::make_shared<MWMemoryObject>();
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
    return *_uniqueMemoryObjects.emplace_back(std::make_shared<MWMemoryObject>());
}

size_t MWMemoryObjectMaps::objectCount() const {
    return _memoryObjects.size() + _sharedCacheMemoryObjects.size() +
           _sharedCacheTranslatedMemoryObjects.size() + _uniqueMemoryObjects.size() +
           _textMemoryObjects.size() + _linkeditMemoryObjects.size();
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

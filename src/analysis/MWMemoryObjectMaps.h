#pragma once

#include <tsl/robin_map.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <vector>

#include "model/MWMemoryObject.h"
#include "process/MWProcess.h"

/// Keys are object identifiers and addresses, whose low bits say little.
struct MWMemoryObjectKeyHash {
    size_t operator()(uint64_t key) const { return key >> 8; }
};

using MWMemoryObjectMap = tsl::robin_map<uint64_t, std::shared_ptr<MWMemoryObject>, MWMemoryObjectKeyHash>;

/// The memory objects of one analysis, each in exactly one place: a region of any process finds the object
/// that it belongs to by a map for its kind and a key in that map. One kernel object that is met as text and
/// as ordinary memory therefore makes two memory objects.
class MWMemoryObjectMaps {
public:
    /// The counts only size the maps.
    MWMemoryObjectMaps(size_t processCount, size_t regionCount);

    /// The object that `region` of `process` belongs to, new when no region of it was met before. A region
    /// without a usable key gets an object of its own at every call.
    MWMemoryObject& objectForRegion(const MWMemoryRegion& region, const MWProcess& process);
    size_t objectCount() const { return _objectCount; }
    /// Every object once.
    void forEachObject(const std::function<void(MWMemoryObject&)>& block) const;

private:
    MWMemoryObjectMap& _mapForRegion(const MWMemoryRegion& region, const MWProcess& process);
    MWMemoryObject& _addUniqueObject();
    std::shared_ptr<MWMemoryObject> _makeObject();

    /// Ordinary regions, by kernel object identifier.
    MWMemoryObjectMap _memoryObjects;
    /// Shared-cache ranges of translated and of native processes, by address.
    MWMemoryObjectMap _sharedCacheTranslatedMemoryObjects;
    MWMemoryObjectMap _sharedCacheMemoryObjects;
    /// Image text and link-edit regions, by kernel object identifier.
    MWMemoryObjectMap _textMemoryObjects;
    MWMemoryObjectMap _linkeditMemoryObjects;
    std::vector<std::shared_ptr<MWMemoryObject>> _uniqueMemoryObjects;
    uint32_t _objectCount = 0;
};

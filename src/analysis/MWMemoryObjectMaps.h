#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "model/MWMemoryObject.h"
#include "process/MWProcess.h"

/// Objects by key, in one flat table: a system has almost as many objects as regions, and the table must not
/// take as much memory as what it leads to.
class MWMemoryObjectMap {
public:
    /// There is room for so many keys before it grows.
    explicit MWMemoryObjectMap(size_t expectedKeys = 0);

    /// The place of the key's object, to be filled by the caller, null for a new key. Holds until the next
    /// call. `key` is not 0.
    MWMemoryObject*& operator[](uint64_t key);

private:
    struct Slot {
        uint64_t key = 0;  ///< 0 for a free one
        MWMemoryObject* object = nullptr;
    };

    Slot& _slotOfKey(uint64_t key);
    void _resize(size_t keys);

    std::vector<Slot> _slots;  ///< their number is a power of two
    size_t _keys = 0;
};

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
    /// Every object once, each at the place that its ordinal says.
    const std::vector<std::shared_ptr<MWMemoryObject>>& objects() const { return _objects; }

private:
    MWMemoryObjectMap& _mapForRegion(const MWMemoryRegion& region, const MWProcess& process);
    MWMemoryObject& _addObject();

    /// Ordinary regions, by kernel object identifier.
    MWMemoryObjectMap _memoryObjects;
    /// Shared-cache ranges of translated and of native processes, by address.
    MWMemoryObjectMap _sharedCacheTranslatedMemoryObjects;
    MWMemoryObjectMap _sharedCacheMemoryObjects;
    /// Image text and link-edit regions, by kernel object identifier.
    MWMemoryObjectMap _textMemoryObjects;
    MWMemoryObjectMap _linkeditMemoryObjects;
    std::vector<std::shared_ptr<MWMemoryObject>> _objects;
};

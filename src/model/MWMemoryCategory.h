#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "model/MWMemoryObject.h"
#include "platform/MWInvariant.h"

/// One row of a category table: the sums over the memory objects (or views of objects) of one name. Named by
/// the first object added. Adding an object twice counts it twice; callers do not.
class MWMemoryCategory {
public:
    MWMemoryCategory() = default;
    /// A summary category has short names only. (initSummary:)
    explicit MWMemoryCategory(bool isSummary) : _isSummary(isSummary) {}

    void addMemoryObject(std::shared_ptr<const MWMemoryObject> object);

    bool isSummary() const { return _isSummary; }
    const std::string& name() const { return _namingObject().name(); }
    std::optional<std::string> detailedName() const;
    std::string fullName() const;
    /// Shown only in verbose output.
    bool verbose() const { return _namingObject().verbose(); }
    const std::shared_ptr<const MWMemoryObject>& firstMemoryObject() const { return _firstMemoryObject; }

    int32_t totalRegions() const { return _totalRegions; }
    void setTotalRegions(int32_t totalRegions) { _totalRegions = totalRegions; }
    uint64_t totalDirtySize() const { return _totalDirtySize; }
    void setTotalDirtySize(uint64_t bytes) { _totalDirtySize = bytes; }
    uint64_t totalSwappedSize() const { return _totalSwappedSize; }
    void setTotalSwappedSize(uint64_t bytes) { _totalSwappedSize = bytes; }
    uint64_t totalCleanSize() const { return _totalCleanSize; }
    void setTotalCleanSize(uint64_t bytes) { _totalCleanSize = bytes; }
    uint64_t totalReclaimableSize() const { return _totalReclaimableSize; }
    void setTotalReclaimableSize(uint64_t bytes) { _totalReclaimableSize = bytes; }
    uint64_t totalWiredSize() const { return _totalWiredSize; }
    void setTotalWiredSize(uint64_t bytes) { _totalWiredSize = bytes; }
    void setFirstMemoryObject(std::shared_ptr<const MWMemoryObject> object) {
        _firstMemoryObject = std::move(object);
    }

private:
    const MWMemoryObject& _namingObject() const {
        MW_INVARIANT(_firstMemoryObject != nullptr, "a category without objects has no name");
        return *_firstMemoryObject;
    }

    bool _isSummary = false;
    int32_t _totalRegions = 0;
    uint64_t _totalDirtySize = 0;
    uint64_t _totalSwappedSize = 0;
    uint64_t _totalCleanSize = 0;
    uint64_t _totalReclaimableSize = 0;
    uint64_t _totalWiredSize = 0;
    std::shared_ptr<const MWMemoryObject> _firstMemoryObject;
};

/// Categories by name: short names in a summarizing table, full names otherwise.
using MWCategoryTable = std::map<std::string, MWMemoryCategory>;

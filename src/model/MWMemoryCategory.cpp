#include "model/MWMemoryCategory.h"

void MWMemoryCategory::addMemoryObject(std::shared_ptr<const MWMemoryObject> object) {
    _totalDirtySize += object->totalDirtySize();
    _totalSwappedSize += object->totalSwappedSize();
    _totalCleanSize += object->totalCleanSize();
    _totalReclaimableSize += object->totalReclaimableSize();
    _totalWiredSize += object->totalWiredSize();
    _totalRegions += static_cast<int32_t>(object->memoryRegions().size());
    if (_firstMemoryObject == nullptr) {
        _firstMemoryObject = std::move(object);
    }
}

std::optional<std::string> MWMemoryCategory::detailedName() const {
    return _isSummary ? std::nullopt : _namingObject().detailedName();
}

std::string MWMemoryCategory::fullName() const {
    return _isSummary ? name() : _namingObject().fullName();
}

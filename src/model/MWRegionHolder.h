#pragma once

#include <cstdint>

/// What the accounting model needs to know of the process that a region belongs to.
class MWRegionHolder {
public:
    virtual ~MWRegionHolder() = default;

    virtual int32_t pid() const = 0;
    /// Bytes for each page of the process's page counts.
    virtual uint64_t pageSize() const = 0;
    /// Whether the process's charge is the sum of its regions' own sizes.
    virtual bool breakDownPhysMemweight() const = 0;
};

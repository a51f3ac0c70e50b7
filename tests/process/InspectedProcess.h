#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/MWHostInterface.h"
#include "process/MWUserProcess.h"
#include "support/FakeHost.h"

using Lines = std::vector<std::string>;

constexpr int32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT;
constexpr int32_t kDirty = kPresent | VM_PAGE_QUERY_PAGE_DIRTY;
constexpr int32_t kSwapped = VM_PAGE_QUERY_PAGE_PAGED_OUT;
constexpr int32_t kClean = kPresent | VM_PAGE_QUERY_PAGE_EXTERNAL;

/// A process of the fake host whose steps a test calls one by one, and for which it writes down what the
/// kernel tells beside the regions.
class InspectedProcess : public MWUserProcess {
public:
    static std::shared_ptr<InspectedProcess> of(int32_t pid) {
        proc_bsdinfo info = {};
        EXPECT_GT(MWHostInterface::current().proc_pidinfo(pid, info), 0);
        auto process = std::make_shared<InspectedProcess>();
        EXPECT_TRUE(process->_initWithBsdInfo(info));
        return process;
    }

    std::optional<MWOwnedObjects> ownedObjects;
    MWImageList listImages() {
        _gatherImageData();
        return *_images;
    }
    void setPageTables(uint64_t bytes) { _ledgers[0] = bytes; }

    using MWUserProcess::_addSubrangesForRegion;
    using MWUserProcess::_enumerateDispositionChunksWithStartAddr;
    using MWUserProcess::_populateMemoryRegionWithPageQueries;
    using MWUserProcess::_setSharedRegionFromPlatform;
    using MWUserProcess::enumerateRegions;

protected:
    std::optional<MWOwnedObjects> _gatherOwnedVmObjects() override { return ownedObjects; }
};

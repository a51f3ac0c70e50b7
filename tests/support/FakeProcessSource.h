#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "process/MWProcess.h"

/// A region as a test writes it down. Sizes are bytes; without `size` it is as large as its parts.
struct RegionLine {
    uint64_t object_id = 0;
    std::string name = "Heap";
    std::optional<std::string> detailedName = std::nullopt;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t clean = 0;
    uint64_t reclaimable = 0;
    uint64_t size = 0;
    uint64_t start = 0;
    uint64_t offset = 0;
    uint8_t segment = SegmentNotImage;
    uint8_t share_mode = SM_PRIVATE;
    bool inSharedCache = false;
    bool owned = false;
    bool fake = false;
    bool wired = false;
    bool verbose = false;
};

inline std::shared_ptr<MWMemoryRegion> makeRegion(const RegionLine& line) {
    auto region = std::make_shared<MWMemoryRegion>();
    region->setObject_id(line.object_id);
    region->setName(line.name);
    region->setDetailedName(line.detailedName);
    region->setDirtySize(line.dirty);
    region->setSwappedSize(line.swapped);
    region->setCleanNonSpecSize(line.clean);
    region->setReclaimableSize(line.reclaimable);
    region->setSize(line.size != 0 ? line.size : line.dirty + line.swapped + line.clean + line.reclaimable);
    region->setStart(line.start);
    region->setOffset(line.offset);
    region->setSegment(line.segment);
    region->setShare_mode(line.share_mode);
    region->setInSharedCache(line.inSharedCache);
    region->setOwnedExclusivelyByParentProcess(line.owned);
    region->setUser_tag(line.fake ? MWFakeRegionTag : 0);
    region->setWired(line.wired);
    region->setVerbose(line.verbose);
    return region;
}

/// A process that gathers the regions that a test wrote down.
class FakeProcessSource : public MWProcess {
public:
    FakeProcessSource(int32_t pid, std::string name, const std::vector<RegionLine>& lines = {}) {
        setPid(pid);
        setDisplayString(name + " [" + std::to_string(pid) + "]");
        setName(std::move(name));
        setIs64bit(true);
        setPageSize(4096);
        for (const RegionLine& line : lines) {
            regions.push_back(makeRegion(line));
        }
    }
    void gatherData() override { setMemoryRegions(regions); }
    MWAuxDataTree auxData() const override { return aux; }
    using MWProcess::_addError;
    using MWProcess::_addWarning;

    MWMemoryRegionList regions;
    MWAuxDataTree aux;
};

/// A tree of aggregating values.
inline MWAuxDataTree makeAuxData(const std::vector<std::pair<std::string, int64_t>>& values) {
    MWAuxDataContainer::Elements elements;
    for (const auto& [name, value] : values) {
        elements[name] = std::make_shared<MWAuxData>(value, true);
    }
    return std::make_shared<MWAuxDataContainer>(std::move(elements));
}

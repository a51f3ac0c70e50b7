#pragma once

#include <cstdint>
#include <span>

#include "platform/linux/OwnershipRuns.h"
#include "platform/linux/PageFrameFlags.h"
#include "platform/linux/PageScan.h"
#include "platform/linux/Procfs.h"

/// What the kernel tells everybody's pages by, found out once for a run.
struct PageFacts {
    const PageFrameFlags& frames;
    uint64_t zeroFrame;  ///< of the zero page; 0 where it is not known
    uint64_t pageSize;
};

/// What this process's own `pagemap` says of memory that was only read: as a rule the zero page. Its frame
/// reads as 0 where frame numbers are hidden.
PagemapEntry lookAtUntouchedPage(int procDirectory, uint64_t pageSize);
/// The frame of the zero page as `untouched` tells it, or 0: some kernels map memory of its own at once.
uint64_t zeroFrameOf(PagemapEntry untouched);

/// The pages of a live process, read from its `pagemap`.
class LivePages : public PageSource {
public:
    /// `memoryDirectory` is /proc/PID, or task/TID of one of its threads; not owned.
    LivePages(int memoryDirectory, const PageFacts& facts)
        : _memoryDirectory(memoryDirectory), _facts(facts) {}

    bool readPages(uint64_t address, std::span<PagemapEntry> entries) override;
    void clearZeroPages(uint64_t address, std::span<PagemapEntry> entries) override;
    uint64_t nextPopulated(uint64_t address, uint64_t end) override;
    bool knowsHoles() override;
    /// See scanPages.
    int scan(const PageScan& scan, std::span<ScannedRange> ranges, uint64_t& walkEnd);

private:
    int _file();
    void _giveWay(uint64_t pages);
    void _clearByFlags(std::span<PagemapEntry> entries) const;

    uint64_t _pagesInARow = 0;  ///< looked at since the process could change its memory map
    int _memoryDirectory;
    PageFacts _facts;
    procfs::Descriptor _pagemap;
};

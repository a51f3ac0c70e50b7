#pragma once

#include <cstdint>
#include <span>

#include "platform/linux/OwnershipRuns.h"
#include "platform/linux/PageFrameFlags.h"
#include "platform/linux/Procfs.h"

/// What the kernel tells everybody's pages by, found out once for a run.
struct PageFacts {
    const PageFrameFlags& frames;
    uint64_t zeroFrame;  ///< the frame of the zero page; 0 where frame numbers are hidden
    uint64_t pageSize;
};

/// The frame that reading untouched anonymous memory maps, looked up in this process's own `pagemap`.
uint64_t findZeroFrame(int procDirectory, uint64_t pageSize);

/// The pages of a live process, read from its `pagemap`.
class LivePages : public PageSource {
public:
    /// `memoryDirectory` is /proc/PID, or task/TID of one of its threads; not owned.
    LivePages(int memoryDirectory, const PageFacts& facts)
        : _memoryDirectory(memoryDirectory), _facts(facts) {}

    bool readPages(uint64_t address, std::span<PagemapEntry> entries) override;
    void clearZeroPages(uint64_t address, std::span<PagemapEntry> entries) override;
    uint64_t nextPopulated(uint64_t address, uint64_t end) override;

private:
    int _file();
    void _clearByFlags(std::span<PagemapEntry> entries) const;

    int _memoryDirectory;
    PageFacts _facts;
    procfs::Descriptor _pagemap;
};

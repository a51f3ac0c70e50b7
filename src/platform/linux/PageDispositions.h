#pragma once

#include <cstdint>
#include <span>

#include "platform/linux/AddressSpace.h"
#include "platform/linux/PageFrameFlags.h"
#include "platform/linux/PagemapEntry.h"

/// Turns the pages of one region, asked for in ascending order, into disposition words.
///
/// Which file pages are dirty and which anonymous pages are lazily freed only `kpageflags` tells. Without it
/// the region's own counts say how many there are, and the first ones in address order are taken for them:
/// the sums are then right, the places a guess. Never more pages of a kind are handed out than the counts say
/// (a page written again after MADV_FREE looks freed to `kpageflags`). So it goes for swapped pages of shmem,
/// which `pagemap` shows as absent.
class PageDispositions {
public:
    PageDispositions() = default;

    /// One word for each entry. `address` is that of the first entry, whose page lies in `region`; a call
    /// that does not go on where the last one ended begins counting anew.
    void fill(const AddressSpaceRegion& region, uint64_t address, std::span<const PagemapEntry> entries,
              const PageFrameFlags& frames, uint64_t pageSize, std::span<int32_t> words);
    /// The same where no page is present. The words are 0.
    void fillHole(const AddressSpaceRegion& region, uint64_t address, uint64_t pageSize,
                  std::span<int32_t> words);

private:
    void _goOnAt(const AddressSpaceRegion& region, uint64_t address, uint64_t pageSize);
    int32_t _word(const AddressSpaceRegion& region, PagemapEntry entry, const PageFrameFlags& frames,
                  uint64_t pageSize);
    bool _isDirtyFilePage(uint64_t flags, bool flagsKnown, uint64_t pageSize);
    bool _isLazilyFreed(uint64_t flags, bool flagsKnown, uint64_t pageSize);

    uint64_t _next = UINT64_MAX;       ///< address behind the last page asked for
    uint64_t _dirtyFileBytesLeft = 0;  ///< of the region's counts, not handed out yet
    uint64_t _lazilyFreedBytesLeft = 0;
    uint64_t _swappedShmemBytesLeft = 0;
};

#pragma once

#include <cstdint>
#include <span>

#include "platform/linux/AddressSpace.h"
#include "platform/linux/Procfs.h"

/// A word of `pagemap`. The frame number reads as 0 without CAP_SYS_ADMIN; the other bits need no privilege.
struct PagemapEntry {
    uint64_t word = 0;

    bool present() const { return (word >> 63U) != 0; }
    bool swapped() const { return ((word >> 62U) & 1U) != 0; }
    /// A page of a file, or shmem.
    bool fileOrShared() const { return ((word >> 61U) & 1U) != 0; }
    uint64_t frame() const { return present() ? word & ((uint64_t{1} << 55U) - 1) : 0; }
};

/// `kpageflags`, the kernel's flags of each page frame: one file for the system, readable by root alone.
class PageFrameFlags {
public:
    explicit PageFrameFlags(procfs::Descriptor file) : _file(std::move(file)) {}

    bool readable() const { return static_cast<bool>(_file); }
    /// 0 when the frame is not known. Costs one read of 8 bytes.
    uint64_t flagsOfFrame(uint64_t frame) const;

    static constexpr uint64_t kDirty = uint64_t{1} << 4U;
    static constexpr uint64_t kAnonymous = uint64_t{1} << 12U;
    static constexpr uint64_t kSwapBacked = uint64_t{1} << 14U;
    static constexpr uint64_t kZeroPage = uint64_t{1} << 24U;

private:
    procfs::Descriptor _file;
};

/// Turns the pages of one region, asked for in ascending order, into disposition words.
///
/// Which file pages are dirty and which anonymous pages are lazily freed only `kpageflags` tells. Without it
/// the region's own counts say how many there are, and the first ones in address order are taken for them:
/// the sums are then right, the places a guess.
class PageDispositions {
public:
    PageDispositions() = default;

    /// One word for each entry. `address` is that of the first entry, whose page lies in `region`; a call
    /// that does not go on where the last one ended begins counting anew.
    void fill(const AddressSpaceRegion& region, uint64_t address, std::span<const PagemapEntry> entries,
              const PageFrameFlags& frames, uint64_t pageSize, std::span<int32_t> words);

private:
    int32_t _word(const AddressSpaceRegion& region, PagemapEntry entry, const PageFrameFlags& frames,
                  uint64_t pageSize);
    bool _isDirtyFilePage(uint64_t flags, bool flagsKnown, uint64_t pageSize);
    bool _isLazilyFreed(uint64_t flags, bool flagsKnown, uint64_t pageSize);

    uint64_t _next = UINT64_MAX;       ///< address behind the last page asked for
    uint64_t _dirtyFileBytesLeft = 0;  ///< of the region's counts, not handed out yet
    uint64_t _lazilyFreedBytesLeft = 0;
};

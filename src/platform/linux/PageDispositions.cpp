#include "platform/linux/PageDispositions.h"

#include <algorithm>

namespace {

// Takes one page off a count of bytes, if there is one left.
bool takePage(uint64_t& bytesLeft, uint64_t pageSize) {
    const uint64_t taken = std::min(bytesLeft, pageSize);
    bytesLeft -= taken;
    return taken != 0;
}

}  // namespace

void PageDispositions::fill(const AddressSpaceRegion& region, uint64_t address,
                            std::span<const PagemapEntry> entries, const PageFrameFlags& frames,
                            uint64_t pageSize, std::span<int32_t> words) {
    _goOnAt(region, address, pageSize);
    for (size_t page = 0; page < entries.size(); ++page) {
        words[page] = _word(region, entries[page], frames, pageSize);
    }
    _next = address + entries.size() * pageSize;
}

void PageDispositions::fillHole(const AddressSpaceRegion& region, uint64_t address, uint64_t pageSize,
                                std::span<int32_t> words) {
    _goOnAt(region, address, pageSize);
    for (auto word = words.begin(); word != words.end() && takePage(_swappedShmemBytesLeft, pageSize);
         ++word) {
        *word = VM_PAGE_QUERY_PAGE_PAGED_OUT;
    }
    _next = address + words.size() * pageSize;
}

void PageDispositions::_goOnAt(const AddressSpaceRegion& region, uint64_t address, uint64_t pageSize) {
    if (address != _next || address == region.start) {
        _dirtyFileBytesLeft = region.dirtyFileBytes;
        _lazilyFreedBytesLeft = region.lazilyFreedBytes;
        _swappedShmemBytesLeft =
            region.backing == Backing::shmem ? region.info.pages_swapped_out * pageSize : 0;
    }
}

int32_t PageDispositions::_word(const AddressSpaceRegion& region, PagemapEntry entry,
                                const PageFrameFlags& frames, uint64_t pageSize) {
    if (entry.swapped()) {
        return VM_PAGE_QUERY_PAGE_PAGED_OUT;
    }
    if (!entry.present()) {
        return takePage(_swappedShmemBytesLeft, pageSize) ? VM_PAGE_QUERY_PAGE_PAGED_OUT : 0;
    }
    const bool isFilePage = region.backing == Backing::file && entry.fileOrShared();
    const bool flagsNeeded = isFilePage ? region.dirtyFileBytes != 0 : region.lazilyFreedBytes != 0;
    const bool frameKnown = flagsNeeded && frames.readable() && entry.frame() != 0;
    const uint64_t flags = frameKnown ? frames.flagsOfFrame(entry.frame()) : 0;
    // Before Linux 6.10 the tail of a large page had not the flags of the page.
    const bool flagsKnown = frameKnown && (flags & PageFrameFlags::kCompoundTail) == 0;
    if (isFilePage) {
        const bool dirty = _isDirtyFilePage(flags, flagsKnown, pageSize);
        return VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL |
               (dirty ? VM_PAGE_QUERY_PAGE_DIRTY : 0);
    }
    if (region.backing == Backing::special) {
        return VM_PAGE_QUERY_PAGE_PRESENT;
    }
    const bool reusable = _isLazilyFreed(flags, flagsKnown, pageSize);
    return VM_PAGE_QUERY_PAGE_PRESENT | (reusable ? VM_PAGE_QUERY_PAGE_REUSABLE : VM_PAGE_QUERY_PAGE_DIRTY);
}

bool PageDispositions::_isDirtyFilePage(uint64_t flags, bool flagsKnown, uint64_t pageSize) {
    const bool mayBe = !flagsKnown || (flags & PageFrameFlags::kDirty) != 0;
    return mayBe && takePage(_dirtyFileBytesLeft, pageSize);
}

bool PageDispositions::_isLazilyFreed(uint64_t flags, bool flagsKnown, uint64_t pageSize) {
    const bool mayBe = !flagsKnown || ((flags & PageFrameFlags::kAnonymous) != 0 &&
                                       (flags & PageFrameFlags::kSwapBacked) == 0);
    return mayBe && takePage(_lazilyFreedBytesLeft, pageSize);
}

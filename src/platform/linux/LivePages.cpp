#include "platform/linux/LivePages.h"

#include <sys/ioctl.h>
#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <vector>

namespace {

// PAGEMAP_SCAN, Linux 6.7; the headers of older systems do not have it.
struct PageRegion {
    uint64_t start;
    uint64_t end;
    uint64_t categories;
};

struct ScanArguments {
    uint64_t size;
    uint64_t flags;
    uint64_t start;
    uint64_t end;
    uint64_t walkEnd;
    uint64_t regions;
    uint64_t regionCount;
    uint64_t maxPages;
    uint64_t categoryInverted;
    uint64_t categoryMask;
    uint64_t categoryAnyOfMask;
    uint64_t returnMask;
};

constexpr unsigned long kPagemapScan = _IOWR('f', 16, ScanArguments);
constexpr uint64_t kIsPresent = 1U << 3U;
constexpr uint64_t kIsSwapped = 1U << 4U;
constexpr uint64_t kIsZeroPage = 1U << 5U;

struct Scan {
    uint64_t start;
    uint64_t end;
    uint64_t categories;  ///< any of them
};

// Fills the regions that have any of the categories and sets where the scan stopped; the number of regions,
// or -1 where the kernel cannot scan.
int scanPages(int pagemap, const Scan& scan, std::span<PageRegion> regions, uint64_t& walkEnd) {
    ScanArguments arguments = {};
    arguments.size = sizeof(arguments);
    arguments.start = scan.start;
    arguments.end = scan.end;
    arguments.regions = reinterpret_cast<uint64_t>(regions.data());
    arguments.regionCount = regions.size();
    arguments.categoryAnyOfMask = scan.categories;
    arguments.returnMask = scan.categories;
    const int count = ioctl(pagemap, kPagemapScan, &arguments);
    walkEnd = arguments.walkEnd;
    return count;
}

}  // namespace

PagemapEntry lookAtUntouchedPage(int procDirectory, uint64_t pageSize) {
    void* page = mmap(nullptr, pageSize, PROT_READ, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    if (page == MAP_FAILED) {
        return {};
    }
    static_cast<void>(*static_cast<volatile char*>(page));
    const procfs::Descriptor pagemap = procfs::open(procDirectory, "self/pagemap");
    PagemapEntry entry;
    const auto offset = static_cast<off_t>(reinterpret_cast<uint64_t>(page) / pageSize * sizeof(entry));
    const bool read = pread(pagemap.get(), &entry, sizeof(entry), offset) == sizeof(entry);
    munmap(page, pageSize);
    return read ? entry : PagemapEntry{};
}

uint64_t zeroFrameOf(PagemapEntry untouched) {
    return untouched.present() && !untouched.exclusive() ? untouched.frame() : 0;
}

int LivePages::_file() {
    if (!_pagemap) {
        _pagemap = procfs::open(_memoryDirectory, "pagemap");
    }
    return _pagemap.get();
}

bool LivePages::readPages(uint64_t address, std::span<PagemapEntry> entries) {
    const auto bytes = std::as_writable_bytes(entries);
    const auto offset = static_cast<off_t>(address / _facts.pageSize * sizeof(PagemapEntry));
    if (pread(_file(), bytes.data(), bytes.size(), offset) != static_cast<ssize_t>(bytes.size())) {
        return false;
    }
    if (_facts.zeroFrame != 0) {
        for (PagemapEntry& entry : entries) {
            entry.word = entry.present() && entry.frame() == _facts.zeroFrame ? 0 : entry.word;
        }
    }
    return true;
}

void LivePages::clearZeroPages(uint64_t address, std::span<PagemapEntry> entries) {
    constexpr size_t kRegionsAtOnce = 256;
    std::array<PageRegion, kRegionsAtOnce> regions;
    const uint64_t end = address + entries.size() * _facts.pageSize;
    for (uint64_t start = address; start < end;) {
        uint64_t walkEnd = end;
        const int count = scanPages(_file(), {start, end, kIsZeroPage}, regions, walkEnd);
        if (count < 0) {
            _clearByFlags(entries);
            return;
        }
        for (const PageRegion& region : std::span(regions).first(static_cast<size_t>(count))) {
            const auto first =
                entries.begin() + static_cast<ptrdiff_t>((region.start - address) / _facts.pageSize);
            std::fill_n(first, (region.end - region.start) / _facts.pageSize, PagemapEntry{});
        }
        if (walkEnd <= start) {
            return;
        }
        start = walkEnd;
    }
}

// Before PAGEMAP_SCAN only the frame's own flags tell, and only root.
void LivePages::_clearByFlags(std::span<PagemapEntry> entries) const {
    if (!_facts.frames.readable()) {
        return;
    }
    for (PagemapEntry& entry : entries) {
        const bool candidate =
            entry.present() && !entry.fileOrShared() && !entry.exclusive() && entry.frame() != 0;
        if (candidate && (_facts.frames.flagsOfFrame(entry.frame()) & PageFrameFlags::kZeroPage) != 0) {
            entry = {};
        }
    }
}

bool LivePages::knowsHoles() {
    std::array<PageRegion, 1> found = {};
    uint64_t walkEnd = 0;
    return scanPages(_file(), {0, _facts.pageSize, kIsPresent}, found, walkEnd) >= 0;
}

uint64_t LivePages::nextPopulated(uint64_t address, uint64_t end) {
    // A bound for the time that one call holds the process's memory map; page tables that are not there are
    // passed over at once.
    constexpr uint64_t kScannedAtOnce = 64ULL << 30U;
    for (uint64_t start = address; start < end;) {
        std::array<PageRegion, 1> found = {};
        const uint64_t limit = std::min(end, start + kScannedAtOnce);
        uint64_t walkEnd = limit;
        const int count = scanPages(_file(), {start, limit, kIsPresent | kIsSwapped}, found, walkEnd);
        if (count != 0) {
            return count < 0 ? address : found[0].start;
        }
        start = limit;
    }
    return end;
}

#include "platform/linux/LivePages.h"

#include <sys/mman.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <ctime>
#include <vector>

#include "platform/MWProgress.h"
#include "platform/linux/PageScan.h"

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

// The kernel takes the process's memory map once more before the process, which waits to change it, has woken
// up: without a pause it waits for 4 ms at each turn, until the kernel sees to it.
void LivePages::_giveWay(uint64_t pages) {
    constexpr uint64_t kMostInARow = 16384;
    constexpr timespec kPause = {.tv_sec = 0, .tv_nsec = 50'000};
    _pagesInARow += pages;
    if (_pagesInARow >= kMostInARow) {
        _pagesInARow = 0;
        nanosleep(&kPause, nullptr);
    }
}

int LivePages::scan(const PageScan& scan, std::span<ScannedRange> ranges, uint64_t& walkEnd) {
    const int count = scanPages(_file(), scan, ranges, walkEnd);
    for (const ScannedRange& range : ranges.first(static_cast<size_t>(std::max(count, 0)))) {
        _giveWay((range.end - range.start) / _facts.pageSize);
    }
    return count;
}

bool LivePages::readPages(uint64_t address, std::span<PagemapEntry> entries) {
    const auto bytes = std::as_writable_bytes(entries);
    const auto offset = static_cast<off_t>(address / _facts.pageSize * sizeof(PagemapEntry));
    const ssize_t count = pread(_file(), bytes.data(), bytes.size(), offset);
    MWProgress::mark();
    _giveWay(entries.size());
    if (count != static_cast<ssize_t>(bytes.size())) {
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
    std::array<ScannedRange, kRegionsAtOnce> regions;
    const uint64_t end = address + entries.size() * _facts.pageSize;
    for (uint64_t start = address; start < end;) {
        uint64_t walkEnd = end;
        const int count = scanPages(_file(), PageScan::forPages(start, end, kIsZeroPage), regions, walkEnd);
        if (count < 0) {
            _clearByFlags(entries);
            return;
        }
        for (const ScannedRange& region : std::span(regions).first(static_cast<size_t>(count))) {
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
    std::array<ScannedRange, 1> found = {};
    uint64_t walkEnd = 0;
    return scanPages(_file(), PageScan::forPages(0, _facts.pageSize, kIsPresent), found, walkEnd) >= 0;
}

uint64_t LivePages::nextPopulated(uint64_t address, uint64_t end) {
    // A bound for the time that one call holds the process's memory map; page tables that are not there are
    // passed over at once.
    constexpr uint64_t kScannedAtOnce = 64ULL << 30U;
    for (uint64_t start = address; start < end;) {
        std::array<ScannedRange, 1> found = {};
        const uint64_t limit = std::min(end, start + kScannedAtOnce);
        uint64_t walkEnd = limit;
        PageScan first = PageScan::forPages(start, limit, kIsPresent | kIsSwapped);
        first.mostPages = 1;  // or the kernel looks for the end of a range of gigabytes
        const int count = scanPages(_file(), first, found, walkEnd);
        if (count != 0) {
            return count < 0 ? address : found[0].start;
        }
        start = limit;
    }
    return end;
}

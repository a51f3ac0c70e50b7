#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <span>
#include <vector>

#include "platform/linux/BackedVma.h"
#include "platform/linux/OwnershipRuns.h"
#include "platform/linux/PageScan.h"

/// Scans the pages of one process, as scanPages does.
using PageScanner = std::function<int(const PageScan&, std::span<ScannedRange>, uint64_t& walkEnd)>;

/// Counts the pages of mappings that `maps` told, by asking for the page tables instead of for smaps: `rss`,
/// `anonymous`, `swap` and what follows from them for memory that no other process maps. Ascending mappings.
/// Answers the ranges of the private file mappings, of which some pages are the file's and others written
/// copies.
///
/// Each step asks for a bounded number of pages: the kernel holds the process's memory map during one, and a
/// process of 4 GiB that wants to map a page would wait 20 ms for a scan of it all.
///
/// None where the kernel does not scan, or where what it tells is not enough: page frames without a page, and
/// swap entries in a shared mapping.
std::optional<std::vector<ScannedRange>> countPages(std::vector<BackedVma>& vmas, const PageScanner& scan);

/// The pages of a process that shares none by fork, as a scan has told them.
class ScannedPages : public PageSource {
public:
    /// Ascending ranges.
    ScannedPages(std::vector<ScannedRange> ranges, uint64_t pageSize)
        : _ranges(std::move(ranges)), _pageSize(pageSize) {}

    bool readPages(uint64_t address, std::span<PagemapEntry> entries) override;
    /// Zero pages were left out by the scan.
    void clearZeroPages(uint64_t, std::span<PagemapEntry>) override {}
    uint64_t nextPopulated(uint64_t address, uint64_t end) override;
    bool knowsHoles() override { return true; }

private:
    std::vector<ScannedRange>::const_iterator _rangeAtOrAbove(uint64_t address) const;

    std::vector<ScannedRange> _ranges;
    uint64_t _pageSize;
};

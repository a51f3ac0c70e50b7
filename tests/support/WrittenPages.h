#pragma once

#include <algorithm>
#include <cstdint>
#include <map>
#include <set>
#include <span>

#include "platform/linux/OwnershipRuns.h"

/// Pages written down by a test, by address; all others are absent.
class WrittenPages : public PageSource {
public:
    std::map<uint64_t, PagemapEntry> pages;
    std::set<uint64_t> zeroPages;
    bool canBeRead = true;

    bool readPages(uint64_t address, std::span<PagemapEntry> entries) override {
        for (PagemapEntry& entry : entries) {
            entry = pages.contains(address) ? pages.at(address) : PagemapEntry{};
            address += 4096;
        }
        return canBeRead;
    }
    void clearZeroPages(uint64_t address, std::span<PagemapEntry> entries) override {
        for (PagemapEntry& entry : entries) {
            entry.word = zeroPages.contains(address) ? 0 : entry.word;
            address += 4096;
        }
    }
    bool knowsHoles() override { return true; }
    uint64_t nextPopulated(uint64_t address, uint64_t end) override {
        const auto found = pages.lower_bound(address);
        return found == pages.end() ? end : std::min(end, found->first);
    }
};

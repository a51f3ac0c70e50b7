#include "platform/linux/PageCounts.h"

#include <algorithm>
#include <array>

namespace {

// 64 MiB of small pages take half a millisecond, where each is looked at.
constexpr uint64_t kMostPagesAtOnce = 16384;
constexpr size_t kMostRangesAtOnce = 512;
// Behind it only the kernel's own mapping lies, which has no pages of the process.
constexpr uint64_t kEndOfUserSpace = uint64_t{1} << 63U;

bool isPrivateFile(const BackedVma& backed) {
    return backed.backing != Backing::anonymous && backed.backing != Backing::special && !backed.vma.shared;
}

/// Adds up ascending ranges.
class PageCounter {
public:
    explicit PageCounter(std::vector<BackedVma>& vmas) : _vmas(vmas) {}

    /// False where the range cannot be understood.
    bool add(const ScannedRange& range) {
        const auto above = [&] { return _next < _vmas.size() && _vmas[_next].vma.end <= range.start; };
        while (above()) {
            ++_next;
        }
        for (size_t index = _next; index < _vmas.size() && _vmas[index].vma.start < range.end; ++index) {
            const procfs::Vma& vma = _vmas[index].vma;
            const ScannedRange part = {std::max(range.start, vma.start), std::min(range.end, vma.end),
                                       range.categories};
            if (!_addTo(_vmas[index], part)) {
                return false;
            }
        }
        return true;
    }

    std::vector<ScannedRange> takeFileRanges() { return std::move(_fileRanges); }

private:
    bool _addTo(BackedVma& backed, const ScannedRange& part) {
        procfs::Vma& vma = backed.vma;
        const uint64_t bytes = part.end - part.start;
        if ((part.categories & kIsZeroPage) != 0) {
            return true;
        }
        const bool ofObject = (part.categories & kIsFileOrShared) != 0;
        const bool present = (part.categories & kIsPresent) != 0;
        if (vma.shared || backed.backing == Backing::special) {
            // The kernel's own data (vvar) is there without being a page.
            const bool counts = present && ofObject;
            vma.rss += counts ? bytes : 0;
            return counts || backed.backing == Backing::special;
        }
        vma.rss += present ? bytes : 0;
        vma.anonymous += present && !ofObject ? bytes : 0;
        vma.swap += present ? 0 : bytes;
        vma.swapPss = vma.swap;
        if (isPrivateFile(backed)) {
            _fileRanges.push_back(part);
        }
        return true;
    }

    std::vector<BackedVma>& _vmas;
    size_t _next = 0;
    std::vector<ScannedRange> _fileRanges;
};

/// Addresses to be scanned with one question.
struct Stretch {
    uint64_t start;
    uint64_t end;
    bool ofObjects;  ///< pages can belong to a file
};

// To tell a page of a file from an anonymous one the kernel looks at the page itself, which costs far more
// than its entry in the page table. Small pieces of anonymous memory are not worth a question of their own.
std::vector<Stretch> stretchesOf(const std::vector<BackedVma>& vmas) {
    constexpr uint64_t kSmall = 256U << 10U;
    std::vector<Stretch> stretches;
    for (const BackedVma& backed : vmas) {
        const procfs::Vma& vma = backed.vma;
        if (vma.end > kEndOfUserSpace) {
            break;
        }
        const bool ofObjects = backed.backing != Backing::anonymous;
        if (!stretches.empty() && stretches.back().ofObjects == ofObjects) {
            stretches.back().end = vma.end;
        } else {
            stretches.push_back({vma.start, vma.end, ofObjects});
        }
    }
    std::vector<Stretch> joined;
    for (Stretch stretch : stretches) {
        stretch.ofObjects = stretch.ofObjects || stretch.end - stretch.start < kSmall;
        if (!joined.empty() && joined.back().ofObjects == stretch.ofObjects) {
            joined.back().end = stretch.end;
        } else {
            joined.push_back(stretch);
        }
    }
    return joined;
}

bool countStretch(const Stretch& stretch, const PageScanner& scan, PageCounter& counter) {
    std::array<ScannedRange, kMostRangesAtOnce> ranges;
    const uint64_t told = kIsPresent | kIsSwapped | kIsZeroPage;
    for (uint64_t start = stretch.start; start < stretch.end;) {
        uint64_t walkEnd = start;
        const int count = scan({.start = start,
                                .end = stretch.end,
                                .anyOf = kIsPresent | kIsSwapped,
                                .told = stretch.ofObjects ? told | kIsFileOrShared : told,
                                .mostPages = kMostPagesAtOnce},
                               ranges, walkEnd);
        if (count < 0 || static_cast<size_t>(count) > ranges.size() || walkEnd <= start) {
            return false;
        }
        for (const ScannedRange& range : std::span(ranges).first(static_cast<size_t>(count))) {
            if (!counter.add(range)) {
                return false;
            }
        }
        start = walkEnd;
    }
    return true;
}

uint64_t entryFor(uint64_t categories) {
    const uint64_t where = (categories & kIsPresent) != 0 ? 63U : 62U;
    const uint64_t ofObject = (categories & kIsFileOrShared) != 0 ? 1 : 0;
    return (uint64_t{1} << where) | (ofObject << 61U) | ((1 - ofObject) << 56U);
}

}  // namespace

std::optional<std::vector<ScannedRange>> countPages(std::vector<BackedVma>& vmas, const PageScanner& scan) {
    PageCounter counter(vmas);
    for (const Stretch& stretch : stretchesOf(vmas)) {
        if (!countStretch(stretch, scan, counter)) {
            return std::nullopt;
        }
    }
    return counter.takeFileRanges();
}

std::vector<ScannedRange>::const_iterator ScannedPages::_rangeAtOrAbove(uint64_t address) const {
    return std::partition_point(_ranges.begin(), _ranges.end(),
                                [=](const ScannedRange& range) { return range.end <= address; });
}

bool ScannedPages::readPages(uint64_t address, std::span<PagemapEntry> entries) {
    std::fill(entries.begin(), entries.end(), PagemapEntry{});
    const uint64_t end = address + entries.size() * _pageSize;
    for (auto range = _rangeAtOrAbove(address); range != _ranges.end() && range->start < end; ++range) {
        const uint64_t from = std::max(range->start, address);
        const uint64_t to = std::min(range->end, end);
        std::fill(entries.begin() + static_cast<ptrdiff_t>((from - address) / _pageSize),
                  entries.begin() + static_cast<ptrdiff_t>((to - address) / _pageSize),
                  PagemapEntry{entryFor(range->categories)});
    }
    return true;
}

uint64_t ScannedPages::nextPopulated(uint64_t address, uint64_t end) {
    const auto range = _rangeAtOrAbove(address);
    return range == _ranges.end() ? end : std::clamp(range->start, address, end);
}

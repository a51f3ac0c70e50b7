#include <algorithm>
#include <vector>

#include "platform/MWHostInterface.h"
#include "platform/MWInvariant.h"
#include "platform/MWSizeMath.h"
#include "process/MWUserProcess.h"

namespace {

constexpr uint64_t kPagesPerQuery = 4096;

/// The pages that [start, end) touches. `lastPage` is the address of the last of them: unlike the end of that
/// page it is an address in any address space.
struct PageSpan {
    uint64_t firstPage;
    uint64_t lastPage;
    uint64_t pages;
};

PageSpan pagesOf(const MWMemoryRegion& region, uint64_t pageSize) {
    const uint64_t first = MWPageFloor(region.start(), pageSize);
    if (region.size() == 0) {
        return {.firstPage = first, .lastPage = first, .pages = 0};
    }
    const uint64_t last = MWPageFloor(region.start() + (region.size() - 1), pageSize);
    return {.firstPage = first, .lastPage = last, .pages = (last - first) / pageSize + 1};
}

/// What the bytes of one page add to a region.
struct PageCharge {
    uint64_t dirty = 0;
    uint64_t swapped = 0;

    /// Anonymous resident memory is charged as dirty: without swapping there is nowhere else to put it.
    void add(int32_t word, uint64_t bytes) {
        const bool present = (word & VM_PAGE_QUERY_PAGE_PRESENT) != 0;
        const bool external = (word & VM_PAGE_QUERY_PAGE_EXTERNAL) != 0;
        if ((word & VM_PAGE_QUERY_PAGE_DIRTY) != 0 || (present && !external)) {
            dirty += bytes;
        } else if ((word & VM_PAGE_QUERY_PAGE_PAGED_OUT) != 0) {
            swapped += bytes;
        }
    }
};

enum class SubrangeKind : uint8_t { absent, dirty, swapped, reclaimable, clean };

SubrangeKind kindOfPage(int32_t word, int32_t reclaimableMask) {
    if ((word & VM_PAGE_QUERY_PAGE_PAGED_OUT) != 0) {
        return SubrangeKind::swapped;
    }
    if ((word & VM_PAGE_QUERY_PAGE_DIRTY) != 0) {
        return SubrangeKind::dirty;
    }
    if ((word & reclaimableMask) != 0) {
        return SubrangeKind::reclaimable;
    }
    return (word & VM_PAGE_QUERY_PAGE_PRESENT) != 0 ? SubrangeKind::clean : SubrangeKind::absent;
}

/// The first word behind `begin` that is another.
template <class Iterator>
Iterator endOfEqual(Iterator begin, Iterator end) {
    return std::find_if(begin, end, [=](int32_t word) { return word != *begin; });
}

/// Joins consecutive pages of one kind into runs, each a sub-range of the region.
class SubrangeRuns {
public:
    SubrangeRuns(MWMemoryRegion& region, uint64_t pageSize)
        : _region(region), _pageSize(pageSize), _offset(region.offset()) {}

    void addPages(SubrangeKind kind, uint64_t count) {
        if (kind != _kind) {
            close();
            _kind = kind;
        }
        (kind == SubrangeKind::absent ? _offset : _length) += count * _pageSize;
    }

    void close() {
        if (_length != 0) {
            _region.addSubrange({.start = _offset, .length = _length}, _totals(), _pageSize);
        }
        _offset += _length;
        _length = 0;
    }

private:
    MWCategoryTotals _totals() const {
        MWCategoryTotals totals;
        totals.dirty = _kind == SubrangeKind::dirty ? _length : 0;
        totals.swapped = _kind == SubrangeKind::swapped ? _length : 0;
        totals.reclaimable = _kind == SubrangeKind::reclaimable ? _length : 0;
        totals.clean = _kind == SubrangeKind::clean ? _length : 0;
        totals.wired = _region.wired() ? _length : 0;
        return totals;
    }

    MWMemoryRegion& _region;
    uint64_t _pageSize;
    SubrangeKind _kind = SubrangeKind::absent;
    uint64_t _offset;
    uint64_t _length = 0;
};

}  // namespace

/// The measurement of one shared-cache region.
struct MWUserProcess::SharedPageCharge {
    const MWMemoryRegion& region;
    PageSpan span;
    bool firstPageCached;
    uint64_t nextPage;  ///< address of the page that the next word describes
    PageCharge charge = {};

    bool startUnaligned() const { return span.firstPage != region.start(); }
    bool endUnaligned(uint64_t pageSize) const { return region.end() % pageSize != 0; }
    /// A gap that begins within a page takes that page's word from its predecessor, which ends there.
    bool knowsFirstPage() const { return firstPageCached || !startUnaligned(); }
    uint64_t pagesToQuery() const { return span.pages - (firstPageCached && span.pages != 0 ? 1 : 0); }
    bool isQueriedPartialFirstPage() const {
        return nextPage == span.firstPage && !firstPageCached && startUnaligned();
    }
    bool isPartialLastPage(uint64_t pageSize) const {
        return nextPage == span.lastPage && endUnaligned(pageSize);
    }
    /// Charges the region its own bytes of the page that `word` describes.
    void addPage(int32_t word, uint64_t pageSize) {
        const uint64_t before = MWSaturatingSubtract(region.start(), nextPage);
        const uint64_t upToEnd = std::min(pageSize, region.end() - nextPage);
        charge.add(word, MWSaturatingSubtract(upToEnd, before));
    }
};

bool MWUserProcess::_enumerateDispositionChunksWithStartAddr(uint64_t startAddress,
                                                             const MWDispositionQuery& query) {
    const uint64_t pages = query.pagesToQuery;
    const uint64_t chunks = pages / kPagesPerQuery + (pages % kPagesPerQuery != 0 ? 1 : 0);
    std::vector<int32_t> words(std::min(pages, kPagesPerQuery));
    for (uint64_t index = 0; index < chunks; ++index) {
        const uint64_t firstPage = index * kPagesPerQuery;
        const uint64_t asked = std::min(pages - firstPage, kPagesPerQuery);
        uint64_t count = asked;
        const kern_return_t result = MWHostInterface::current().mach_vm_page_range_query(
            *_task, startAddress + firstPage * pageSize(), asked * pageSize(), words, count);
        if (result != KERN_SUCCESS) {
            MWHostInterface::current().mach_error("mach_vm_page_range_query", result);
            _processMachVMError(result, {.expectingErrorOnExit = KERN_INVALID_ARGUMENT});
            return false;
        }
        // A page that nothing is told of is absent: those behind it keep their places.
        std::fill(words.begin() + static_cast<ptrdiff_t>(std::min(count, asked)), words.end(), 0);
        query.block({.words = std::span(words).first(asked), .index = index, .count = chunks});
    }
    return true;
}

bool MWUserProcess::_populateMemoryRegionWithPageQueries(const std::shared_ptr<MWMemoryRegion>& region,
                                                         const vm_region_submap_info_64&) {
    const PageSpan span = pagesOf(*region, pageSize());
    SharedPageCharge measured = {.region = *region,
                                 .span = span,
                                 .firstPageCached = span.firstPage == _cachedDispositionAddress,
                                 .nextPage = span.firstPage};
    if (measured.firstPageCached) {
        measured.addPage(_cachedDisposition, pageSize());
        measured.nextPage += pageSize();
    }
    bool success = true;
    if (!region->unusedSharedCacheRegion()) {
        success = _enumerateDispositionChunksWithStartAddr(
            measured.nextPage, {.pagesToQuery = measured.pagesToQuery(), .block = [&](const auto& chunk) {
                                    for (const int32_t word : chunk.words) {
                                        _chargeSharedPage(measured, word);
                                    }
                                }});
    } else if (measured.knowsFirstPage() && measured.endUnaligned(pageSize()) &&
               measured.pagesToQuery() != 0) {
        _pendingUnusedSharedRegion = region;
    }
    region->setSwappedSize(measured.charge.swapped);
    region->setDirtySize(measured.charge.dirty);
    return success;
}

void MWUserProcess::_chargeSharedPage(SharedPageCharge& measured, int32_t word) {
    measured.addPage(word, pageSize());
    if (measured.isQueriedPartialFirstPage()) {
        _creditPendingGap(measured.region, word);
    }
    if (measured.isPartialLastPage(pageSize())) {
        _cachedDispositionAddress = measured.span.lastPage;
        _cachedDisposition = word;
    }
    measured.nextPage += pageSize();
}

void MWUserProcess::_creditPendingGap(const MWMemoryRegion& nextRegion, int32_t word) {
    const std::shared_ptr<MWMemoryRegion> gap = std::move(_pendingUnusedSharedRegion);
    _pendingUnusedSharedRegion.reset();
    if (gap == nullptr || gap->end() != nextRegion.start()) {
        return;
    }
    PageCharge share;
    share.add(word, gap->end() - pagesOf(*gap, pageSize()).lastPage);
    gap->setDirtySize(gap->dirtySize() + share.dirty);
    gap->setSwappedSize(gap->swappedSize() + share.swapped);
}

void MWUserProcess::_addSubrangesForRegion(MWMemoryRegion& region, int32_t purgeState) {
    MW_INVARIANT(!region.ownedExclusivelyByParentProcess(), "An exclusively owned region has no sub-ranges");
    const PageSpan span = pagesOf(region, pageSize());
    if (region.offset() > UINT64_MAX - MWSaturatingMultiply(span.pages, pageSize())) {
        // The region's end would lie beyond the largest offset that an object can have.
        return;
    }
    const int32_t reclaimableMask =
        purgeState == VM_PURGABLE_VOLATILE ? VM_PAGE_QUERY_PAGE_PRESENT : VM_PAGE_QUERY_PAGE_REUSABLE;
    SubrangeRuns runs(region, pageSize());
    const bool complete = _enumerateDispositionChunksWithStartAddr(
        span.firstPage, {.pagesToQuery = span.pages, .block = [&](const MWDispositionChunk& chunk) {
                             for (auto word = chunk.words.begin(); word != chunk.words.end();) {
                                 const auto end = endOfEqual(word, chunk.words.end());
                                 runs.addPages(kindOfPage(*word, reclaimableMask),
                                               static_cast<uint64_t>(end - word));
                                 word = end;
                             }
                         }});
    if (complete) {
        runs.close();
    }
}

#include "model/MWRangeList.h"

#include <algorithm>
#include <array>
#include <iterator>
#include <utility>

#include "model/MWMemoryRegion.h"
#include "platform/MWInvariant.h"

namespace {

constexpr uint64_t kMax = UINT64_MAX;

/// Pages [first, end) by number. Page numbers, unlike byte offsets, can name the end of the 64-bit space.
struct PageSpan {
    uint64_t first;
    uint64_t end;
};

uint64_t saturatedSum(uint64_t a, uint64_t b) {
    return b > kMax - a ? kMax : a + b;
}

/// The span as far as it lies within the 64-bit space, so that start + (length - 1) never wraps.
MWSubrange cutAtEndOfSpace(MWSubrange range) {
    const uint64_t room = 0 - range.start;  // 2^64 - start, and 0 for the whole space
    if (room != 0) {
        range.length = std::min(range.length, room);
    }
    return range;
}

/// The span rounded outward to whole pages; an empty span within a page takes up that page.
PageSpan pagesOf(MWSubrange range, uint64_t pageSize) {
    const uint64_t first = range.start / pageSize;
    if (range.length == 0) {
        return {first, first + (range.start % pageSize != 0 ? 1 : 0)};
    }
    const uint64_t last = range.start + (range.length - 1);
    return {first, saturatedSum(last / pageSize, 1)};
}

PageSpan pagesOf(const MWRangeListNode& node, uint64_t pageSize) {
    return pagesOf(MWSubrange{node.start, node.length}, pageSize);
}

uint64_t overlapInBytes(PageSpan a, PageSpan b, uint64_t pageSize) {
    const uint64_t first = std::max(a.first, b.first);
    const uint64_t end = std::min(a.end, b.end);
    return end <= first ? 0 : std::min(end - first, kMax / pageSize) * pageSize;
}

/// a + b less what they may share, but never less than either had alone.
uint64_t mergedCount(uint64_t a, uint64_t b, uint64_t overlap) {
    const auto [smaller, larger] = std::minmax(a, b);
    return larger + (smaller > overlap ? smaller - overlap : 0);
}

/// Extends `added` over `node` and merges the counts of both.
void absorb(MWRangeListNode& added, const MWRangeListNode& node, uint64_t overlap) {
    static constexpr std::array kinds = {&MWRangeListNode::clean, &MWRangeListNode::dirty,
                                         &MWRangeListNode::swapped, &MWRangeListNode::reclaimable,
                                         &MWRangeListNode::wired};
    for (const auto kind : kinds) {
        added.*kind = mergedCount(added.*kind, node.*kind, overlap);
    }
    const uint64_t start = std::min(added.start, node.start);
    added.length = std::max(saturatedSum(added.start - start, added.length),
                            saturatedSum(node.start - start, node.length));
    added.start = start;
}

bool liesBefore(const MWRangeListNode& node, uint64_t firstPage, uint64_t pageSize) {
    return pagesOf(node, pageSize).end < firstPage;
}

}  // namespace

MWRangeList::~MWRangeList() {
    while (_rangeListHead != nullptr) {
        delete std::exchange(_rangeListHead, _rangeListHead->next);
    }
}

void MWRangeList::addRange(MWSubrange range, uint64_t pageSize, const MWCategoryTotals& memoryTotal) {
    const uint64_t page = std::max<uint64_t>(pageSize, 1);
    const MWSubrange span = cutAtEndOfSpace(range);
    const PageSpan pages = pagesOf(span, page);
    MWRangeListNode added = {.start = span.start,
                             .length = span.length,
                             .clean = memoryTotal.clean,
                             .dirty = memoryTotal.dirty,
                             .swapped = memoryTotal.swapped,
                             .reclaimable = memoryTotal.reclaimable,
                             .wired = memoryTotal.wired};

    MWRangeListNode*& link = _linkBehindNodesBefore(span.start, page);
    while (link != nullptr && pagesOf(*link, page).first <= pages.end) {
        absorb(added, *link, overlapInBytes(pages, pagesOf(*link, page), page));
        if (_index) {
            _index->erase(link->start);
        }
        delete std::exchange(link, link->next);
    }
    added.next = link;
    link = new MWRangeListNode(added);
    if (_index) {
        _index->emplace(link->start, link);
    }
}

MWRangeListNode*& MWRangeList::_linkBehindNodesBefore(uint64_t start, uint64_t pageSize) {
    constexpr size_t kLongWalk = 64;
    if (_index) {
        return _linkByIndex(start, pageSize);
    }
    const uint64_t firstPage = start / pageSize;
    if (_lastPredecessor != nullptr && !liesBefore(*_lastPredecessor, firstPage, pageSize)) {
        _lastPredecessor = nullptr;
    }
    MWRangeListNode** link = _lastPredecessor == nullptr ? &_rangeListHead : &_lastPredecessor->next;
    for (size_t steps = 0; *link != nullptr && liesBefore(**link, firstPage, pageSize); ++steps) {
        if (steps == kLongWalk) {
            _makeIndex();
            return _linkByIndex(start, pageSize);
        }
        _lastPredecessor = *link;
        link = &_lastPredecessor->next;
    }
    return *link;
}

void MWRangeList::_makeIndex() {
    _index = std::make_unique<Index>();
    for (MWRangeListNode* node = _rangeListHead; node != nullptr; node = node->next) {
        _index->emplace_hint(_index->end(), node->start, node);
    }
}

// What begins behind the span's start does not lie before it; of what begins in front, only nodes that will
// be absorbed do not.
MWRangeListNode*& MWRangeList::_linkByIndex(uint64_t start, uint64_t pageSize) {
    auto place = _index->lower_bound(start);
    while (place != _index->begin() && !liesBefore(*std::prev(place)->second, start / pageSize, pageSize)) {
        --place;
    }
    return place == _index->begin() ? _rangeListHead : std::prev(place)->second->next;
}

void MWRangeList::addRegion(const MWMemoryRegion& region, uint64_t pageSize) {
    if (region.subrangeList() != nullptr) {
        _addRangeList(*region.subrangeList(), pageSize);
        return;
    }
    addRange({.start = region.offset(), .length = region.size()}, pageSize, region.totals());
}

void MWRangeList::_addRangeList(const MWRangeList& other, uint64_t pageSize) {
    MW_INVARIANT(&other != this, "A range list is never added to itself.");
    for (const MWRangeListNode* node = other.head(); node != nullptr; node = node->next) {
        addRange({.start = node->start, .length = node->length}, pageSize,
                 {.dirty = node->dirty,
                  .swapped = node->swapped,
                  .clean = node->clean,
                  .reclaimable = node->reclaimable,
                  .wired = node->wired});
    }
}

MWCategoryTotals MWRangeList::sum() const {
    MWCategoryTotals total;
    for (const MWRangeListNode* node = _rangeListHead; node != nullptr; node = node->next) {
        total.dirty += node->dirty;
        total.swapped += node->swapped;
        total.clean += node->clean;
        total.reclaimable += node->reclaimable;
        total.wired += node->wired;
    }
    return total;
}

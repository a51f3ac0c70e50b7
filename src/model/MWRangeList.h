#pragma once

#include <cstdint>
#include <map>
#include <memory>

#include "model/MWCategoryTotals.h"

class MWMemoryRegion;

/// A span within a memory object, in bytes.
struct MWSubrange {
    uint64_t start = 0;
    uint64_t length = 0;
};

/// One span of an object with its bytes by kind.
struct MWRangeListNode {
    uint64_t start = 0;
    uint64_t length = 0;
    uint64_t clean = 0;
    uint64_t dirty = 0;
    uint64_t swapped = 0;
    uint64_t reclaimable = 0;
    uint64_t wired = 0;
    MWRangeListNode* next = nullptr;
};

/// The spans of one memory object, merged so that a page which several of them cover counts once.
///
/// Nodes are in ascending order of start and never overlap. A span added with page size P ends up in one
/// node with every node that it overlaps or touches once both are rounded outward to multiples of P:
///
///     list      [ A )        [ B )          [ C )
///     add             [   S      )
///     list      [ A )  [  S + B  )          [ C )
///
/// The kinds of S + B are the sums less the overlap, but never less than what either had alone. Only the
/// owner of the list adds to it.
class MWRangeList {
public:
    MWRangeList() = default;
    ~MWRangeList();
    MWRangeList(const MWRangeList&) = delete;
    MWRangeList& operator=(const MWRangeList&) = delete;

    /// `memoryTotal.regions` is ignored. A page size of 0, as a damaged snapshot may have, rounds nothing.
    /// Costs the walk to the span's place: constant when spans come in ascending order, else the logarithm of
    /// the list.
    void addRange(MWSubrange range, uint64_t pageSize, const MWCategoryTotals& memoryTotal);
    /// The region's sub-ranges when it has them, else its whole span of its object.
    void addRegion(const MWMemoryRegion& region, uint64_t pageSize);
    /// Adds every node of `other`, which is left as it was.
    void _addRangeList(const MWRangeList& other, uint64_t pageSize);
    /// The sums over all nodes; `regions` is 0.
    MWCategoryTotals sum() const;

    /// The first node, none for an empty list; for walking, nodes stay the list's.
    const MWRangeListNode* head() const { return _rangeListHead; }

private:
    using Index = std::map<uint64_t, MWRangeListNode*>;

    /// The link (head or `next`) behind the last node that ends before the span's first page without touching
    /// it.
    MWRangeListNode*& _linkBehindNodesBefore(uint64_t start, uint64_t pageSize);
    MWRangeListNode*& _linkByIndex(uint64_t start, uint64_t pageSize);
    void _makeIndex();

    MWRangeListNode* _rangeListHead = nullptr;
    /// The node before the last added one, none at the head. A later span that it also lies before is placed
    /// from here, since all nodes in front of it lie before that span too. An addition frees no node up to
    /// it.
    MWRangeListNode* _lastPredecessor = nullptr;
    /// All nodes by start, once a walk was long. Few lists have more than some nodes, and most of those grow
    /// at their end.
    std::unique_ptr<Index> _index;
};

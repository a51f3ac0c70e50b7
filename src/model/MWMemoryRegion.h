#pragma once

#include <compare>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <utility>

#include "model/MWRangeList.h"
#include "model/MWSharedText.h"
#include "platform/MWHostRecords.h"

class MWMemoryObject;

/// Values of a region's `segment`.
enum MWSegmentKind : uint8_t {
    SegmentNone = 0,      ///< made outside the region walk
    SegmentNotImage = 1,  ///< of the walk, covered by no loaded image
    SegmentText = 2,
    SegmentData = 3,
    SegmentLinkedit = 4,
};

/// The start of a region that has no address: owned memory that is not mapped, and page tables.
inline constexpr uint64_t MWNoAddress = UINT64_MAX;

/// One span of an address space (or owned memory without an address) with what gathering learned of its
/// pages. All sizes and offsets are bytes. Filled by one gathering thread; afterwards only the analysis
/// changes it.
class MWMemoryRegion {
public:
    bool wired() const { return _wired; }
    void setWired(bool wired) { _wired = wired; }
    bool inSharedCache() const { return _inSharedCache; }
    void setInSharedCache(bool inSharedCache) { _inSharedCache = inSharedCache; }
    /// A part of the shared-cache mapping that no image covers.
    bool unusedSharedCacheRegion() const { return _unusedSharedCacheRegion; }
    void setUnusedSharedCacheRegion(bool unused) { _unusedSharedCacheRegion = unused; }
    /// The backing object is owned by this process and charged to it alone.
    bool ownedExclusivelyByParentProcess() const { return _ownedExclusivelyByParentProcess; }
    void setOwnedExclusivelyByParentProcess(bool owned) { _ownedExclusivelyByParentProcess = owned; }
    /// Listed only in verbose output.
    bool verbose() const { return _verbose; }
    void setVerbose(bool verbose) { _verbose = verbose; }

    uint8_t segment() const { return _segment; }
    void setSegment(uint8_t segment) { _segment = segment; }
    uint8_t share_mode() const { return _share_mode; }
    void setShare_mode(uint8_t share_mode) { _share_mode = share_mode; }
    uint32_t user_tag() const { return _user_tag; }
    void setUser_tag(uint32_t user_tag) { _user_tag = user_tag; }
    /// The object that collected this region, not owned; none until the analysis has joined its process.
    MWMemoryObject* memoryObject() const { return _memoryObject; }
    void setMemoryObject(MWMemoryObject* memoryObject) { _memoryObject = memoryObject; }
    /// Category or segment name.
    const std::string& name() const { return *_name; }
    /// Not null; most regions share their names with others.
    void setName(MWSharedText name) { _name = std::move(name); }
    void setName(std::string name) { _name = std::make_shared<const std::string>(std::move(name)); }
    /// File path, image path or other detail.
    std::optional<std::string> detailedName() const {
        return _detailedName == nullptr ? std::nullopt : std::optional(*_detailedName);
    }
    /// Null for none.
    void setDetailedName(MWSharedText detailedName) { _detailedName = std::move(detailedName); }
    void setDetailedName(std::optional<std::string> detailedName) {
        _detailedName =
            detailedName ? std::make_shared<const std::string>(*std::move(detailedName)) : nullptr;
    }
    /// Of the region's start within its backing object.
    uint64_t offset() const { return _offset; }
    void setOffset(uint64_t offset) { _offset = offset; }
    /// First address, or MWNoAddress.
    uint64_t start() const { return _start; }
    void setStart(uint64_t start) { _start = start; }
    uint64_t size() const { return _size; }
    void setSize(uint64_t size) { _size = size; }
    /// Dirty, or otherwise charged, resident bytes; without the swapped ones.
    uint64_t dirtySize() const { return _dirtySize; }
    void setDirtySize(uint64_t dirtySize) { _dirtySize = dirtySize; }
    /// Resident bytes that the system may take back at any time.
    uint64_t reclaimableSize() const { return _reclaimableSize; }
    void setReclaimableSize(uint64_t reclaimableSize) { _reclaimableSize = reclaimableSize; }
    uint64_t swappedSize() const { return _swappedSize; }
    void setSwappedSize(uint64_t swappedSize) { _swappedSize = swappedSize; }
    /// Resident bytes that are neither dirty nor reclaimable.
    uint64_t cleanNonSpecSize() const { return _cleanNonSpecSize; }
    void setCleanNonSpecSize(uint64_t cleanNonSpecSize) { _cleanNonSpecSize = cleanNonSpecSize; }
    /// The backing object, the same for every process that maps it; 0 where there is none.
    uint64_t object_id() const { return _object_id; }
    void setObject_id(uint64_t object_id) { _object_id = object_id; }
    /// Page-exact breakdown, when one was taken.
    const std::shared_ptr<MWRangeList>& subrangeList() const { return _subrangeList; }

    /// `start` + `size`; MWNoAddress for a region without an address.
    uint64_t end() const;
    /// Stores the size; `end` below `start` is an invariant violation.
    void setEnd(uint64_t end);
    /// By start ascending, then by size descending, so that an enclosing region precedes what it contains.
    std::strong_ordering compare(const MWMemoryRegion& other) const;
    uint64_t wiredSize() const { return _wired ? _size : 0; }
    /// The region's own sizes; `regions` is 0.
    MWCategoryTotals totals() const {
        return {.dirty = _dirtySize,
                .swapped = _swappedSize,
                .clean = _cleanNonSpecSize,
                .reclaimable = _reclaimableSize,
                .wired = wiredSize()};
    }
    /// `subrange` lies in the backing object, not in the address space.
    void addSubrange(MWSubrange subrange, const MWCategoryTotals& memoryTotal, uint64_t pageSize);
    void freeSubrangeList() { _subrangeList.reset(); }
    /// "NAME DETAIL", or the name alone where there is no detail.
    std::string fullName() const;
    /// Whether different processes can see different pages of the region's object.
    bool eligibleForProcessView() const;
    /// Whether a page-exact breakdown is worth taking: a shareable region of more than one page whose pages
    /// are of mixed kinds.
    bool eligibleForSubrangesUsingPageSize(uint64_t pageSize) const;
    bool isFake() const { return _user_tag == MWFakeRegionTag; }

    /// The category under which a region of this tag is reported; never empty.
    static std::string categoryNameForTag(uint32_t tag);
    /// The suffix that names the kernel ledger of an owned object; none for tags 0 and 1.
    static std::optional<std::string> vmLedgerNameForTag(uint64_t ledgerTag);

private:
    static MWSharedText _noText();

    bool _wired = false;
    bool _inSharedCache = false;
    bool _unusedSharedCacheRegion = false;
    bool _ownedExclusivelyByParentProcess = false;
    bool _verbose = false;
    uint8_t _segment = SegmentNone;
    uint8_t _share_mode = 0;
    uint32_t _user_tag = 0;
    MWMemoryObject* _memoryObject = nullptr;
    MWSharedText _name = _noText();
    MWSharedText _detailedName;
    uint64_t _offset = 0;
    uint64_t _start = 0;
    uint64_t _size = 0;
    uint64_t _dirtySize = 0;
    uint64_t _reclaimableSize = 0;
    uint64_t _swappedSize = 0;
    uint64_t _cleanNonSpecSize = 0;
    uint64_t _object_id = 0;
    std::shared_ptr<MWRangeList> _subrangeList;
};

#include <algorithm>
#include <utility>

#include "platform/MWSizeMath.h"
#include "process/MWUserProcess.h"

namespace {

const MWSharedText& linkeditDetail() {
    static const auto text = std::make_shared<const std::string>("rtld shared cache");
    return text;
}

constexpr const char* kGapName = "unused rtld shared cache area";

bool isMeasured(uint8_t kind) {
    return kind != SegmentText && kind != SegmentLinkedit;
}

uint64_t roundUp(uint64_t address, uint64_t alignment) {
    return MWPageFloor(MWSaturatingAdd(address, alignment - 1), alignment);
}

}  // namespace

/// One mapping on its way to being cut up:
///
///     mapping   [                                       )
///     images          [ previous )      [  image  )
///     regions   [ gap [  piece   )
///                                ^ cursor
struct MWUserProcess::SharedMappingSplit {
    MWMemoryRegionList& regions;
    const MWSharedRegionMapping& mapping;
    uint64_t end;                    ///< of the mapping
    uint64_t cursor;                 ///< what is below has its regions
    const MWImage* image = nullptr;  ///< the first that reaches above the cursor, or none
    const MWImage* previous = nullptr;

    const MWImage* imageFrom(uint64_t address) const {
        return mapping.imageEnumerator.nextImageForStart(address, {.end = end});
    }
    std::shared_ptr<MWMemoryRegion> regionTo(uint64_t start, uint64_t regionEnd) const;
    uint8_t kindOfGap(uint64_t gapEnd, uint64_t pageSize) const;
};

std::shared_ptr<MWMemoryRegion> MWUserProcess::SharedMappingSplit::regionTo(uint64_t start,
                                                                            uint64_t regionEnd) const {
    const vm_region_submap_info_64& info = mapping.withRegionInfo;
    auto region = std::make_shared<MWMemoryRegion>();
    region->setStart(start);
    region->setEnd(regionEnd);
    region->setUser_tag(info.user_tag);
    region->setObject_id(info.object_id_full);
    region->setShare_mode(info.share_mode);
    region->setOffset(info.offset + (start - mapping.forRegionInSharedRegionStartingAt));
    region->setInSharedCache(true);
    region->setWired(info.user_wired_count != 0);
    return region;
}

// The bytes that a gap has of an image's page were written, or not, with the image's: they count alike.
uint8_t MWUserProcess::SharedMappingSplit::kindOfGap(uint64_t gapEnd, uint64_t pageSize) const {
    const auto samePage = [=](uint64_t a, uint64_t b) { return a / pageSize == b / pageSize; };
    if (previous != nullptr && samePage(previous->end(), cursor)) {
        return previous->segment();
    }
    if (image != nullptr && samePage(image->start(), gapEnd)) {
        return image->segment();
    }
    return SegmentNone;
}

bool MWUserProcess::_addRegionsToArray(MWMemoryRegionList& regions, const MWSharedRegionMapping& mapping) {
    _pendingUnusedSharedRegion.reset();
    const uint64_t start = mapping.forRegionInSharedRegionStartingAt;
    SharedMappingSplit split = {.regions = regions,
                                .mapping = mapping,
                                .end = MWSaturatingAdd(start, mapping.withSize),
                                .cursor = start};
    split.image = split.imageFrom(start);
    while (split.cursor < split.end) {
        const bool atGap = split.image == nullptr || split.cursor < split.image->start();
        if (!(atGap ? _addSharedCacheGap(split) : _addSharedCacheImagePiece(split))) {
            return false;
        }
    }
    return true;
}

// Whole pages of a gap were never written by anybody; only pages that it has in common with images count.
bool MWUserProcess::_addSharedCacheGap(SharedMappingSplit& split) {
    const uint64_t end = split.image == nullptr ? split.end : std::min(split.image->start(), split.end);
    const auto gap = split.regionTo(split.cursor, end);
    gap->setName(kGapName);
    gap->setUnusedSharedCacheRegion(true);
    gap->setSegment(split.kindOfGap(end, pageSize()));
    const bool wholePages = split.cursor % pageSize() == 0 && end % pageSize() == 0;
    if (isMeasured(gap->segment()) && !wholePages &&
        !_populateMemoryRegionWithPageQueries(gap, split.mapping.withRegionInfo)) {
        return false;
    }
    split.regions.push_back(gap);
    split.cursor = end;
    return true;
}

bool MWUserProcess::_addSharedCacheImagePiece(SharedMappingSplit& split) {
    const MWImage& image = *split.image;
    if (image.end() <= split.cursor) {
        // Images that overlap, or an empty one, which every search at its address finds again.
        const MWImage* next = split.imageFrom(split.cursor);
        split.image = next != &image ? next : split.imageFrom(split.cursor + 1);
        return true;
    }
    uint64_t end = std::min(image.end(), split.end);
    const MWImage* next = split.imageFrom(end);
    const uint64_t alignment = _sharedRegionAlignmentSize;
    const uint64_t nextStart = next == nullptr ? 0 : next->start();
    if (next != &image && split.cursor % alignment == 0 && nextStart % alignment == 0) {
        // Images are laid out in whole units, and what fills up the last one is the image's.
        end = roundUp(end, alignment);
    }
    const auto piece = split.regionTo(split.cursor, end);
    piece->setName(image.name());
    piece->setDetailedName(image.segment() == SegmentLinkedit ? linkeditDetail() : image.ownerPath());
    piece->setSegment(image.segment());
    if (isMeasured(image.segment()) &&
        !_populateMemoryRegionWithPageQueries(piece, split.mapping.withRegionInfo)) {
        return false;
    }
    split.regions.push_back(piece);
    split.cursor = end;
    split.previous = std::exchange(split.image, next);
    return true;
}

#include "model/MWMemoryRegion.h"

#include <fmt/format.h>

#include <algorithm>
#include <array>

#include "platform/MWHostInterface.h"
#include "platform/MWInvariant.h"
#include "platform/MWRegionTags.h"

namespace {

constexpr uint32_t kTagCount = 256;

/// By tag; null for a tag without a name of the program's own.
constexpr std::array<const char*, kTagCount> kNamesByTag = [] {
    std::array<const char*, kTagCount> names = {};
    for (const MWRegionTagName& entry : MWRegionTagNames) {
        names.at(entry.tag) = entry.name;
    }
    return names;
}();

const std::string& appSpecificName(uint32_t tag) {
    static const auto names = [] {
        std::array<std::string, MWTagLastAppSpecific - MWTagFirstAppSpecific + 1> built;
        for (size_t i = 0; i < built.size(); ++i) {
            built.at(i) = fmt::format("app-specific tag {}", i + 1);
        }
        return built;
    }();
    return names.at(tag - MWTagFirstAppSpecific);
}

/// The program's own name, else the system's; none where the system has only a generic one.
std::optional<std::string> nameForSmallTag(uint32_t tag) {
    if (const char* name = kNamesByTag.at(tag); name != nullptr) {
        return name;
    }
    auto described = MWHostInterface::current().describeRegionTypeForTag(tag);
    if (described && described->starts_with("Memory Tag")) {
        described.reset();
    }
    return described;
}

}  // namespace

MWSharedText MWMemoryRegion::_noText() {
    static const auto& none = *new std::string;
    return MWUncountedText(none);
}

uint64_t MWMemoryRegion::end() const {
    // Saturating, which also keeps the end of a region without an address at MWNoAddress.
    return _size > UINT64_MAX - _start ? UINT64_MAX : _start + _size;
}

void MWMemoryRegion::setEnd(uint64_t end) {
    MW_INVARIANT(end >= _start, "A region's end is never below its start.");
    _size = end - _start;
}

std::strong_ordering MWMemoryRegion::compare(const MWMemoryRegion& other) const {
    const auto byStart = _start <=> other._start;
    return std::is_neq(byStart) ? byStart : other._size <=> _size;
}

void MWMemoryRegion::addSubrange(MWSubrange subrange, const MWCategoryTotals& memoryTotal,
                                 uint64_t pageSize) {
    if (_subrangeList == nullptr) {
        _subrangeList = std::make_shared<MWRangeList>();
    }
    _subrangeList->addRange(subrange, pageSize, memoryTotal);
}

std::string MWMemoryRegion::fullName() const {
    const bool hasDetail = _detailedName != nullptr && !_detailedName->empty();
    return hasDetail ? *_name + ' ' + *_detailedName : *_name;
}

bool MWMemoryRegion::eligibleForProcessView() const {
    const bool isPrivate =
        _share_mode == SM_PRIVATE || _share_mode == SM_EMPTY || _share_mode == SM_PRIVATE_ALIASED;
    const bool isImageSegment =
        _segment == SegmentText || _segment == SegmentData || _segment == SegmentLinkedit;
    return !isFake() && !_inSharedCache && !isPrivate && !isImageSegment;
}

bool MWMemoryRegion::eligibleForSubrangesUsingPageSize(uint64_t pageSize) const {
    if (!eligibleForProcessView() || _size <= pageSize || _ownedExclusivelyByParentProcess) {
        return false;
    }
    const std::array kinds = {_dirtySize, _swappedSize, _cleanNonSpecSize, _reclaimableSize};
    return std::ranges::none_of(kinds, [this](uint64_t bytes) { return bytes == _size; }) &&
           std::ranges::any_of(kinds, [](uint64_t bytes) { return bytes != 0; });
}

std::string MWMemoryRegion::categoryNameForTag(uint32_t tag) {
    if (tag >= MWTagFirstAppSpecific && tag <= MWTagLastAppSpecific) {
        return appSpecificName(tag);
    }
    if (tag < kTagCount) {
        if (auto name = nameForSmallTag(tag)) {
            return *std::move(name);
        }
    }
    if (tag == MWFakeRegionTag) {
        return "Owned physical memweight (unmapped)";
    }
    return fmt::format("tag {}", static_cast<int32_t>(tag));
}

std::optional<std::string> MWMemoryRegion::vmLedgerNameForTag(uint64_t ledgerTag) {
    static constexpr std::array<const char*, 6> names = {nullptr, nullptr,    "network",
                                                         "media", "graphics", "neural"};
    if (ledgerTag >= names.size()) {
        return fmt::format("VM ledger tag {}", ledgerTag);
    }
    const char* name = names.at(ledgerTag);
    return name == nullptr ? std::nullopt : std::optional<std::string>(name);
}

#include "process/MWHeapsnapProcess.h"

#include <fmt/core.h>

#include <algorithm>
#include <limits>
#include <utility>

#include "platform/MWHostInterface.h"
#include "platform/MWInvariant.h"
#include "platform/MWRegionTags.h"

namespace {

bool contains(std::string_view text, std::string_view part) {
    return text.find(part) != std::string_view::npos;
}

uint32_t fieldOf(uint64_t number) {
    return static_cast<uint32_t>(std::min<uint64_t>(number, std::numeric_limits<uint32_t>::max()));
}

bool isReservedName(const std::string& type) {
    return type == "commpage (reserved)" || type == "GPU Carveout (reserved)";
}

// The numbers of names that programs gave to their memory are given out anew in each run.
uint32_t tagOf(const HeapsnapRegion& region) {
    const bool isGivenOut = region.userTag >= MWTagFirstDynamic && region.userTag <= MWTagLastDynamic;
    return isGivenOut && !region.type->empty() ? MWHostInterface::current().tagForRegionType(*region.type)
                                               : region.userTag;
}

}  // namespace

tl::expected<std::shared_ptr<MWHeapsnapProcess>, MWError> MWHeapsnapProcess::processWithHeapsnap(
    const std::string& path) {
    auto reader = HeapsnapReader::openFile(path);
    if (!reader) {
        MWError error = std::move(reader.error());
        if (!error.description) {
            error = {.domain = MemweightErrorDomain,
                     .code = MWErrorHeapsnapUnknown,
                     .description = "heapsnap initialization failed with unknown error"};
        }
        return tl::make_unexpected(std::move(error));
    }
    std::shared_ptr<MWHeapsnapProcess> process(new MWHeapsnapProcess(*std::move(reader)));
    if (auto initialized = process->_initWithHeapsnap(); !initialized) {
        return tl::make_unexpected(std::move(initialized.error()));
    }
    return process;
}

MWHeapsnapProcess::Initialized MWHeapsnapProcess::_initWithHeapsnap() {
    const HeapsnapProcess& saved = _graph->process();
    proc_bsdinfo info = {};
    info.pbi_pid = static_cast<uint32_t>(saved.pid);
    info.pbi_flags = saved.is64bit ? PROC_FLAG_LP64 : 0;
    if (!_initWithBsdInfo(info)) {
        return tl::make_unexpected(MWError());
    }
    setName(saved.name);
    setDisplayString(fmt::format("{} [{}] (heapsnap)", saved.name, saved.pid));
    const MWPlatformCode platform = _platformFromDescription();
    if (!_setSharedRegionFromPlatform(
            platform == MWPlatformUnknown || saved.hasSharedCache ? platform : MWPlatformNoSharedCache)) {
        return tl::make_unexpected(
            MWError{.domain = MemweightErrorDomain,
                    .code = MWErrorHeapsnapPlatform,
                    .description = "Unable to determine platform from heap snapshot process description"});
    }
    _setIdleExitStatus(IdleExitUnknown);
    return {};
}

MWPlatformCode MWHeapsnapProcess::_platformFromDescription() const {
    const std::string& description = _graph->process().description;
    if (contains(description, "X86-64")) {
        return MWPlatformX86_64;
    }
    if (contains(description, "X86")) {
        return MWPlatformX86;
    }
    if (contains(description, "ARM64_32")) {
        return MWPlatformArm64_32;
    }
    if (contains(description, "ARM64")) {
        return MWPlatformArm64;
    }
    if (contains(description, "ARM")) {
        return contains(_graph->process().binaryImages, "arm64_32") ? MWPlatformArm64_32 : MWPlatformArm;
    }
    return MWPlatformUnknown;
}

void MWHeapsnapProcess::_gatherIsTranslated() {
    setIsTranslated(contains(_graph->process().description, "(translated)"));
}

void MWHeapsnapProcess::_gatherPhysMemweight() {
    setPhys_memweight(_graph->process().physMemweight);
    _phys_memweight_peak = _graph->process().physMemweightPeak;
}

// Inside of the shared cache the page counts are bytes: the page queries take them as that.
vm_region_submap_info_64 MWHeapsnapProcess::_recordOf(const HeapsnapRegion& region) const {
    const bool isShared = _isInSharedCache(region.start);
    const auto converted = [&](uint64_t bytes) {
        const uint64_t pages = pageSize() == 0 ? 0 : bytes / pageSize();
        return fieldOf(isShared ? bytes : pages);
    };
    vm_region_submap_info_64 info;
    info.protection = region.protection;
    info.max_protection = region.maxProtection;
    info.offset = region.offset;
    info.user_tag = tagOf(region);
    info.pages_resident = converted(region.resident);
    info.pages_shared_now_private = converted(region.sharedNowPrivate);
    info.pages_swapped_out = converted(region.swappedOut);
    info.pages_dirtied = converted(region.dirty);
    info.ref_count = region.referenceCount;
    info.external_pager = region.externalPager ? 1 : 0;
    info.share_mode = region.shareMode;
    info.is_submap = region.submap & 1U;
    info.object_id = static_cast<uint32_t>(region.objectId);
    info.pages_reusable = converted(region.reusable);
    info.object_id_full = region.objectId;
    return info;
}

void MWHeapsnapProcess::_collectImage(std::optional<MWImage>& pending, const HeapsnapRegion& region) {
    if (!pending) {
        pending.emplace();
    }
    pending->setName(region.type);
    if (pending->segment() == SegmentNone) {
        return;
    }
    pending->setStart(region.start);
    pending->setSize(region.length);
    pending->setOwnerPath(region.path);
    _images->push_back(*std::exchange(pending, std::nullopt));
}

void MWHeapsnapProcess::enumerateRegions(const MWRegionCallback& callback) {
    std::optional<MWImage> pending;
    _graph->enumerateRegions([&](const HeapsnapRegion& region) {
        MWWalkedRegion walked = {.address = region.start,
                                 .size = region.length,
                                 .info = _recordOf(region),
                                 .purgeState = static_cast<int32_t>(region.purgeState)};
        _collectImage(pending, region);
        if (region.externalPager && !region.path->empty()) {
            walked.path = *region.path;
        }
        if (isReservedName(*region.type)) {
            walked.name = *region.type;
            walked.verbose = true;
        }
        return callback(walked);
    });
}

bool MWHeapsnapProcess::_populateMemoryRegionWithPageQueries(const std::shared_ptr<MWMemoryRegion>& region,
                                                             const vm_region_submap_info_64& regionInfo) {
    MW_INVARIANT(region->dirtySize() == 0, "memoryRegion.dirtySize == 0");
    MW_INVARIANT(region->swappedSize() == 0, "memoryRegion.swappedSize == 0");
    region->setDirtySize(regionInfo.pages_dirtied);
    region->setSwappedSize(regionInfo.pages_swapped_out);
    return true;
}

#include "process/MWRecordedProcess.h"

#include <fmt/core.h>
#include <sys/utsname.h>

#include <string>
#include <string_view>

#include "platform/MWHostInterface.h"
#include "platform/MWSizeMath.h"

namespace {

// A reader has to know the architecture by one of these names. For one that it does not know, any will do:
// it matters only where there is a shared cache.
std::string architectureName(bool is64bit) {
    utsname system = {};
    uname(&system);
    const std::string_view machine = system.machine;
    if (machine == "x86_64" || machine == "i686") {
        return is64bit ? "X86-64" : "X86";
    }
    const char* name = is64bit ? "ARM64" : "ARM";
    return machine.starts_with("aarch64") || machine.starts_with("arm")
               ? name
               : fmt::format("{} (read as {})", machine, name);
}

}  // namespace

std::shared_ptr<MWRecordedProcess> MWRecordedProcess::processWithPid(int32_t pid) {
    proc_bsdinfo info = {};
    if (MWHostInterface::current().proc_pidinfo(pid, info) != sizeof(info) ||
        (info.pbi_flags & PROC_FLAG_SYSTEM) != 0) {
        return nullptr;
    }
    std::shared_ptr<MWRecordedProcess> process(new MWRecordedProcess);
    return process->_initWithBsdInfo(info) ? process : nullptr;
}

HeapsnapProcess MWRecordedProcess::identity() const {
    return {.pid = pid(),
            .name = name(),
            .is64bit = is64bit(),
            .description = fmt::format("[{}] {}", pid(), architectureName(is64bit())),
            .binaryImages = "",
            .hasSharedCache = _hasSharedCache(),
            .pageSize = static_cast<uint32_t>(pageSize()),
            .physMemweight = phys_memweight(),
            .physMemweightPeak = _phys_memweight_peak,
            .breakdown = breakDownPhysMemweight()};
}

void MWRecordedProcess::record(const std::function<void(const HeapsnapRegion&)>& take) {
    _gatherImageData();
    MWImageEnumerator images(_images);
    enumerateRegions([&](const MWWalkedRegion& walked) {
        take(_regionOf(images, walked));
        return false;
    });
    _addTaskWarnings();
}

void MWRecordedProcess::_processMachVMError(kern_return_t result, MWExpectedError) {
    MWUserProcess::_processMachVMError(result, {.expectingErrorOnExit = KERN_SUCCESS});
}

HeapsnapRegion MWRecordedProcess::_regionOf(MWImageEnumerator& images, const MWWalkedRegion& walked) const {
    const auto bytes = [this](uint64_t pages) { return MWSaturatingMultiply(pages, pageSize()); };
    const vm_region_submap_info_64& info = walked.info;
    const MWImage* image = images.nextImageForStart(walked.address, {.end = walked.address + walked.size});
    std::string type = image != nullptr ? *image->name() : MWMemoryRegion::categoryNameForTag(info.user_tag);
    std::string path = image != nullptr ? *image->ownerPath() : walked.path.value_or("");
    HeapsnapRegion region;
    region.start = walked.address;
    region.length = walked.size;
    region.offset = info.offset;
    region.resident = bytes(info.pages_resident);
    region.sharedNowPrivate = bytes(info.pages_shared_now_private);
    region.swappedOut = bytes(info.pages_swapped_out);
    region.dirty = bytes(info.pages_dirtied);
    region.reusable = bytes(info.pages_reusable);
    region.objectId = info.object_id_full;
    region.protection = info.protection;
    region.maxProtection = info.max_protection;
    region.userTag = info.user_tag;
    region.submap = info.is_submap;
    region.purgeState = static_cast<uint32_t>(walked.purgeState);
    region.referenceCount = static_cast<uint16_t>(std::min<uint32_t>(info.ref_count, UINT16_MAX));
    region.shareMode = info.share_mode;
    region.externalPager = info.external_pager != 0;
    region.type = std::make_shared<const std::string>(std::move(type));
    region.path = std::make_shared<const std::string>(std::move(path));
    return region;
}

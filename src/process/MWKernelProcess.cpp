#include "process/MWKernelProcess.h"

#include <fmt/core.h>
#include <fmt/printf.h>

#include <algorithm>
#include <array>
#include <cstdio>
#include <string_view>
#include <utility>

#include "platform/MWKernelTags.h"
#include "platform/MWSizeMath.h"
#include "platform/MWTerminalText.h"
#include "platform/MWUTF8.h"

namespace {

// Object identifiers: an index with a bit that keeps zones and sites apart.
constexpr uint64_t kSiteObjects = 0x100000000;
constexpr uint64_t kZoneObjects = 0x200000000;

constexpr const char* kNoName = "unknown";

template <size_t N>
std::string textOf(const std::array<char, N>& text) {
    return {text.begin(), std::find(text.begin(), text.end(), '\0')};
}

bool isUTF8(std::string_view text) {
    while (!text.empty()) {
        const size_t length = MWUTF8CharacterLength(text);
        if (length == 0) {
            return false;
        }
        text.remove_prefix(length);
    }
    return true;
}

uint8_t typeOf(const mach_memory_info_t& info) {
    return static_cast<uint8_t>(info.flags & MWSiteTypeMask);
}

bool isCounter(const mach_memory_info_t& info) {
    return (info.flags & (MWSiteTypeMask | MWSiteZone | MWSiteWired)) == MWSiteCounter;
}

std::shared_ptr<MWMemoryRegion> regionOfZone(const mach_zone_name_t& name, const mach_zone_info_t& zone,
                                             uint64_t index) {
    auto region = std::make_shared<MWMemoryRegion>();
    const std::string text = textOf(name.mzn_name);
    region->setName(text.empty() ? kNoName : text);
    if (zone.mzi_collectable != 0) {
        region->setDirtySize(MWSaturatingMultiply(zone.mzi_count, zone.mzi_elem_size));
        region->setReclaimableSize(MWSaturatingSubtract(zone.mzi_cur_size, region->dirtySize()));
    } else {
        region->setDirtySize(zone.mzi_cur_size);
    }
    region->setSize(zone.mzi_cur_size);
    region->setObject_id(kZoneObjects + index);
    return region;
}

std::shared_ptr<MWMemoryRegion> regionOfSite(const mach_memory_info_t& info, uint64_t index) {
    const bool isWired = (info.flags & MWSiteWired) != 0;
    const bool isHidden = (info.flags & MWSiteHidden) != 0;
    const bool isUserWired = info.site == MWKernelTagUserWired;
    auto region = std::make_shared<MWMemoryRegion>();
    if ((info.flags & MWSiteZone) != 0 || !isWired || isHidden || isUserWired) {
        region->setCleanNonSpecSize(info.size);
        if (isHidden) {
            region->setDetailedName("(hidden)");
        } else if (isUserWired) {
            region->setDetailedName("(user wired)");
        }
    } else {
        region->setDirtySize(info.size);
    }
    region->setWired(isWired);
    region->setSize(info.size);
    region->setUser_tag(static_cast<uint32_t>(index));
    region->setObject_id(kSiteObjects + index);
    return region;
}

std::string nameOfTag(uint64_t tag) {
    const auto* found = std::ranges::find(MWKernelTagNames, tag, &MWKernelTagName::tag);
    return found != std::end(MWKernelTagNames) ? found->name : fmt::format("VM_KERN_MEMORY_{}", tag);
}

std::string nameOfExtension(uint64_t loadTag, const MWKextMap& kexts) {
    const auto found = kexts.find(loadTag);
    return found != kexts.end() ? found->second.bundleIdentifier : fmt::format("unloaded kmod {}", loadTag);
}

std::string nameOfCode(uint64_t address, KernelSymbolicator& symbolicator) {
    auto symbol = address != 0 ? symbolicator.nameForAddress(address) : std::nullopt;
    return symbol ? *std::move(symbol) : fmt::format("site 0x{:x}", address);
}

std::string nameOfCounter(uint64_t counter) {
    return counter < MWKernelCounterNames.size() ? MWKernelCounterNames.at(counter)
                                                 : fmt::format("VM_KERN_COUNT_{}", counter);
}

std::string nameOfSite(const mach_memory_info_t& info, const MWKernelProcess::Naming& naming) {
    if ((info.flags & MWSiteNamed) != 0) {
        if (std::string name = textOf(info.name); !name.empty() && isUTF8(name)) {
            return name;
        }
    }
    switch (typeOf(info)) {
        case MWSiteTag:
            return nameOfTag(info.site);
        case MWSiteExtension:
            return nameOfExtension(info.site, naming.kexts);
        case MWSiteKernel:
            return nameOfCode(info.site, naming.symbolicator);
        case MWSiteCounter:
            return nameOfCounter(info.site);
        default:
            return fmt::format("unknown site (0x{:x}, 0x{:x})", typeOf(info), info.site);
    }
}

}  // namespace

std::shared_ptr<MWKernelProcess> MWKernelProcess::initWithBsdInfo(const proc_bsdinfo& info) {
    std::shared_ptr<MWKernelProcess> process(new MWKernelProcess);
    return process->_initWithBsdInfo(info) ? process : nullptr;
}

bool MWKernelProcess::_initWithBsdInfo(const proc_bsdinfo& info) {
    if (!MWProcess::_initWithBsdInfo(info)) {
        return false;
    }
    _setIdleExitStatus(IdleExitIneligible);
    return true;
}

void MWKernelProcess::gatherData() {
    MWHostInterface& host = MWHostInterface::current();
    MWKernelMemoryArrays arrays;
    if (const kern_return_t result = host.mach_memory_info(arrays); result != KERN_SUCCESS) {
        _printFailure("mach_memory_info", result);
        _addError(fmt::format("{}: {}", displayString(), host.mach_error_string(result)));
        return;
    }
    _auxData.clear();
    MWMemoryRegionList regions;
    const size_t zoneCount = std::min(arrays.zoneNames.size(), arrays.zones.size());
    for (size_t index = 0; index < zoneCount; ++index) {
        regions.push_back(regionOfZone(arrays.zoneNames[index], arrays.zones[index], index));
    }
    _deallocate(arrays.zones);
    _addWiredData(arrays.records, {.zoneNames = arrays.zoneNames}, regions);
    _deallocate(arrays.zoneNames);
    _deallocate(arrays.records);
    setMemoryRegions(std::move(regions));
}

MWAuxDataTree MWKernelProcess::auxData() const {
    MWAuxDataContainer::Elements elements;
    elements["Maps"] = std::make_shared<MWAuxDataContainer>(_auxData);
    return std::make_shared<MWAuxDataContainer>(std::move(elements));
}

void MWKernelProcess::_addWiredData(std::span<const mach_memory_info_t> records, ZoneNames zones,
                                    MWMemoryRegionList& regions) {
    const auto symbolicator = _createSymbolicator();
    const MWKextMap kexts = kextTags();
    const Naming naming = {.kexts = kexts, .symbolicator = *symbolicator, .zones = zones};
    for (size_t index = 0; index < records.size(); ++index) {
        const mach_memory_info_t& info = records[index];
        if (info.site == 0 && (isCounter(info) ? info.mapped : info.size) == 0) {
            continue;
        }
        if (isCounter(info)) {
            _addCounter(info, naming);
            continue;
        }
        auto region = regionOfSite(info, index);
        _setNameForRegion(*region, info, naming);
        regions.push_back(std::move(region));
    }
}

void MWKernelProcess::_addCounter(const mach_memory_info_t& info, const Naming& naming) {
    const std::string name =
        _nameForWiredInfo(info, {.kexts = naming.kexts, .symbolicator = naming.symbolicator, .zones = {}});
    _auxData[name] = std::make_shared<MWAuxData>(static_cast<int64_t>(info.mapped), false);
}

MWKextMap MWKernelProcess::kextTags() {
    return _kextTagsWithKextInfo(MWHostInterface::current().loadedKernelExtensions());
}

MWKextMap MWKernelProcess::_kextTagsWithKextInfo(const std::vector<MWKernelExtension>& kextInfo) {
    MWKextMap kexts;
    for (const MWKernelExtension& kext : kextInfo) {
        kexts[kext.OSBundleLoadTag] = kext;
    }
    return kexts;
}

std::unique_ptr<KernelSymbolicator> MWKernelProcess::_createSymbolicator() {
    return MWHostInterface::current().makeKernelSymbolicator();
}

std::string MWKernelProcess::_nameForWiredInfo(const mach_memory_info_t& info, const Naming& naming) {
    std::string name = nameOfSite(info, naming);
    const auto zones = naming.zones.zoneNames;
    if ((info.flags & MWSiteZone) != 0 && info.zone < zones.size()) {
        name = fmt::format("{}[{}]", name, textOf(zones[info.zone].mzn_name));
    }
    return name.empty() ? kNoName : name;
}

void MWKernelProcess::_setNameForRegion(MWMemoryRegion& region, const mach_memory_info_t& info,
                                        const Naming& naming) {
    region.setName(_nameForWiredInfo(info, naming));
    if (typeOf(info) != MWSiteKernel) {
        return;
    }
    if (const auto location = naming.symbolicator.sourceLocationForAddress(info.site)) {
        region.setDetailedName(fmt::format("({}:{})", location->path, location->line));
    }
}

void MWKernelProcess::_printFailure(const char* operation, kern_return_t result) const {
    fmt::fprintf(stderr, "%s: %s: %s\n", MWErrorText(displayString()), operation,
                 MWHostInterface::current().mach_error_string(result));
}

template <class Record>
void MWKernelProcess::_deallocate(std::span<const Record> records) const {
    const kern_return_t result =
        MWHostInterface::current().vm_deallocate(records.data(), records.size_bytes());
    if (result != KERN_SUCCESS) {
        _printFailure("vm_deallocate", result);
    }
}

#include "platform/linux/AddressSpace.h"

#include <algorithm>
#include <utility>

namespace {

using procfs::Vma;

constexpr std::string_view kSysVPath = "/SYSV";

bool startsWithAny(std::string_view text, std::initializer_list<std::string_view> prefixes) {
    return std::any_of(prefixes.begin(), prefixes.end(),
                       [&](auto prefix) { return text.starts_with(prefix); });
}

uint64_t residentBytes(const Vma& vma) {
    return vma.rss + vma.sharedHugetlb + vma.privateHugetlb;
}

// Resident bytes that cannot be dropped. An anonymous page read back from swap can be clean and still has to
// go back to swap, so anonymous bytes count whole.
uint64_t dirtyBytes(const BackedVma& backed) {
    const Vma& vma = backed.vma;
    if (backed.backing == Backing::shmem || backed.backing == Backing::hugetlb) {
        return residentBytes(vma);
    }
    const uint64_t anonymous = vma.anonymous - std::min(vma.lazyFree, vma.anonymous);
    return std::max(vma.sharedDirty + vma.privateDirty, anonymous);
}

// Whether a private mapping of an object has pages that the process has written: these are its own.
bool hasOwnPages(const Vma& vma) {
    return !vma.shared && (vma.anonymous != 0 || vma.swap != 0);
}

bool isUntouched(const Vma& vma) {
    return residentBytes(vma) == 0 && vma.swap == 0;
}

uint8_t shareMode(const BackedVma& backed) {
    const Vma& vma = backed.vma;
    if (backed.backing == Backing::anonymous && isUntouched(vma)) {
        return SM_EMPTY;
    }
    if (vma.shared) {
        return SM_SHARED;
    }
    return backed.backing == Backing::file ? SM_COW : SM_PRIVATE;
}

uint32_t protectionBits(bool read, bool write, bool execute) {
    return (read ? 1U : 0U) | (write ? 2U : 0U) | (execute ? 4U : 0U);
}

/// An object and the region's place in it.
struct ObjectPlace {
    uint64_t identifier = 0;
    uint64_t offset = 0;
};

// The inode of an anonymous kernel file names all files of its kind, so it identifies nothing.
bool hasInodeOfItsOwn(const Vma& vma) {
    return vma.inode != 0 && vma.path.starts_with('/');
}

ObjectPlace placeOf(const BackedVma& backed, const AddressSpaceOwner& owner, const ObjectIdentity& identity) {
    const Vma& vma = backed.vma;
    const ObjectPlace own = {identity.process(owner.pid, owner.startTime, vma.start), 0};
    if (backed.backing == Backing::anonymous) {
        return isUntouched(vma) ? ObjectPlace{} : own;
    }
    if (hasOwnPages(vma)) {
        return own;
    }
    if (vma.path.starts_with(kSysVPath)) {
        return {identity.sysV(vma.device(), vma.inode, owner.ipcNamespace), vma.offset};
    }
    if (hasInodeOfItsOwn(vma) || vma.path.starts_with("[anon_shmem:")) {
        return {identity.file(vma.device(), vma.inode), vma.offset};
    }
    return own;
}

uint32_t pageCount(uint64_t bytes, uint64_t pageSize) {
    return static_cast<uint32_t>(std::min<uint64_t>(bytes / pageSize, UINT32_MAX));
}

vm_region_submap_info_64 infoFor(const BackedVma& backed, uint64_t pageSize) {
    const Vma& vma = backed.vma;
    vm_region_submap_info_64 info;
    info.protection = protectionBits(vma.readable, vma.writable, vma.executable);
    info.max_protection = protectionBits(vma.has(procfs::VmFlagMayRead), vma.has(procfs::VmFlagMayWrite),
                                         vma.has(procfs::VmFlagMayExecute));
    info.pages_resident = pageCount(residentBytes(vma), pageSize);
    info.pages_reusable = pageCount(vma.lazyFree, pageSize);
    info.pages_swapped_out = pageCount(vma.swap, pageSize);
    info.pages_dirtied = pageCount(dirtyBytes(backed), pageSize);
    info.external_pager = backed.backing == Backing::file ? 1 : 0;
    info.share_mode = shareMode(backed);
    info.user_wired_count = vma.has(procfs::VmFlagLocked) || vma.has(procfs::VmFlagHugetlb) ? 1 : 0;
    info.ref_count = 1;
    return info;
}

AddressSpaceRegion regionFor(BackedVma backed, const AddressSpaceOwner& owner,
                             const AddressSpaceContext& context) {
    Vma& vma = backed.vma;
    AddressSpaceRegion region = {.start = vma.start,
                                 .size = vma.size(),
                                 .info = infoFor(backed, context.pageSize),
                                 .backing = backed.backing};
    const ObjectPlace place = placeOf(backed, owner, context.identity);
    region.info.object_id_full = place.identifier;
    region.info.object_id = static_cast<uint32_t>(place.identifier);
    region.info.offset = place.offset;
    region.lazilyFreedBytes = vma.lazyFree;
    if (backed.backing == Backing::file) {
        const uint64_t dirty = vma.sharedDirty + vma.privateDirty;
        region.dirtyFileBytes = dirty - std::min(vma.anonymous, dirty);
        region.path = std::move(vma.path);
    }
    return region;
}

}  // namespace

Backing backingOf(const Vma& vma, ShmemDevices& shmemDevices, int processDirectory) {
    const std::string_view path = vma.path;
    if (vma.has(procfs::VmFlagHugetlb)) {
        return Backing::hugetlb;
    }
    if (path.empty() || startsWithAny(path, {"[heap]", "[stack", "[anon:"}) ||
        (path == "/dev/zero" && !vma.shared)) {
        return Backing::anonymous;
    }
    // SysV segments are told by their path, never by inode 0: their inode is the segment's id.
    if (startsWithAny(path, {kSysVPath, "/memfd:", "[anon_shmem:", "/secretmem"})) {
        return Backing::shmem;
    }
    if (!path.starts_with('/')) {
        return Backing::special;
    }
    if (shmemDevices.isShmem(vma.device(), processDirectory)) {
        return Backing::shmem;
    }
    return startsWithAny(path, {"/dev/", "/dmabuf:"}) ? Backing::special : Backing::file;
}

AddressSpace::AddressSpace(std::vector<Vma> vmas, const AddressSpaceOwner& owner,
                           const AddressSpaceContext& context) {
    std::vector<BackedVma> backed;
    backed.reserve(vmas.size());
    for (Vma& vma : vmas) {
        const Backing backing = backingOf(vma, context.shmemDevices, owner.directory);
        backed.push_back({std::move(vma), backing});
    }
    const std::vector<uint32_t> tags = tagsForVmas(backed, context.names);
    _regions.reserve(backed.size());
    for (size_t index = 0; index < backed.size(); ++index) {
        _regions.push_back(regionFor(std::move(backed[index]), owner, context));
        _regions.back().info.user_tag = tags[index];
    }
}

const AddressSpaceRegion* AddressSpace::regionAtOrAbove(uint64_t address) const {
    const auto found = std::partition_point(_regions.begin(), _regions.end(),
                                            [=](const auto& region) { return region.end() <= address; });
    return found == _regions.end() ? nullptr : &*found;
}

#include "platform/linux/AddressSpace.h"

#include <algorithm>
#include <utility>

#include "platform/MWHeap.h"
#include "platform/MWRegionTags.h"

namespace {

using procfs::Vma;

bool startsWithAny(std::string_view text, std::initializer_list<std::string_view> prefixes) {
    return std::any_of(prefixes.begin(), prefixes.end(),
                       [&](auto prefix) { return text.starts_with(prefix); });
}

// Resident bytes that cannot be dropped. An anonymous page read back from swap can be clean and still has to
// go back to swap, so anonymous bytes count whole.
uint64_t dirtyBytes(const BackedVma& backed) {
    const Vma& vma = backed.vma;
    if (backed.backing == Backing::shmem || backed.backing == Backing::hugetlb) {
        return vma.resident();
    }
    const uint64_t anonymous = vma.anonymous - std::min(vma.lazyFree, vma.anonymous);
    return std::max(vma.sharedDirty + vma.privateDirty, anonymous);
}

// Whether a private mapping of an object has pages that are the process's own. Huge pages are not counted as
// anonymous; of theirs the counts say how many nobody else maps.
bool hasOwnPages(const Vma& vma) {
    if (vma.has(procfs::VmFlagHugetlb)) {
        return !vma.shared && vma.sharedHugetlb == 0 && vma.privateHugetlb != 0;
    }
    return !vma.shared && (vma.anonymous != 0 || vma.swap != 0);
}

bool isUntouched(const Vma& vma) {
    return vma.resident() == 0 && vma.swap == 0;
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
    if (isUntouched(vma)) {
        return {};  // no pages, no object: a whole span without pages would hide those of its other sharers
    }
    const ObjectPlace own = {identity.process(owner.pid, owner.startTime, vma.start), 0};
    if (backed.backing == Backing::anonymous || hasOwnPages(vma)) {
        return own;
    }
    if (isSysVSegment(vma)) {
        return {identity.sysV(vma.device(), vma.inode, owner.ipcNamespace), vma.offset};
    }
    if (hasInodeOfItsOwn(vma) || vma.path.starts_with("[anon_shmem:")) {
        return {identity.file(vma.device(), vma.inode), vma.offset};
    }
    return own;
}

// Page-cache pages that a mapping counts as dirty: what its written copies leave of the count.
uint64_t dirtyFileBytes(const Vma& vma) {
    const uint64_t dirty = vma.sharedDirty + vma.privateDirty;
    return dirty - std::min(vma.anonymous, dirty);
}

uint32_t pageCount(uint64_t bytes, uint64_t pageSize) {
    return static_cast<uint32_t>(std::min<uint64_t>(bytes / pageSize, UINT32_MAX));
}

vm_region_submap_info_64 infoFor(const BackedVma& backed, uint64_t pageSize) {
    const Vma& vma = backed.vma;
    vm_region_submap_info_64 info;
    info.protection = protectionBits(vma.readable, vma.writable, vma.executable);
    // Every readable mapping has flags; those of mappings that `maps` told are not known.
    info.max_protection =
        vma.flags == 0 ? info.protection
                       : protectionBits(vma.has(procfs::VmFlagMayRead), vma.has(procfs::VmFlagMayWrite),
                                        vma.has(procfs::VmFlagMayExecute));
    info.pages_resident = pageCount(vma.resident(), pageSize);
    info.pages_reusable = pageCount(vma.lazyFree, pageSize);
    info.pages_swapped_out = pageCount(vma.swap, pageSize);
    info.pages_dirtied = pageCount(dirtyBytes(backed), pageSize);
    info.external_pager = backed.backing == Backing::file ? 1 : 0;
    info.share_mode = shareMode(backed);
    info.user_wired_count = vma.has(procfs::VmFlagLocked) || vma.has(procfs::VmFlagHugetlb) ? 1 : 0;
    info.ref_count = 1;
    return info;
}

uint64_t takeUpTo(uint64_t& left, uint64_t most) {
    const uint64_t taken = std::min(left, most);
    left -= taken;
    return taken;
}

bool isWritten(PageOwner owner) {
    return owner == PageOwner::process || owner == PageOwner::family;
}

/// Makes the regions of one process.
class RegionBuilder {
public:
    RegionBuilder(const AddressSpaceOwner& owner, PageSource& pages, const AddressSpaceContext& context,
                  std::vector<AddressSpaceRegion>& regions)
        : _owner(owner), _pages(pages), _context(context), _regions(regions) {}

    /// `image` is the one whose segment the mapping is, or null.
    void add(const BackedVma& backed, uint32_t tag, const LinuxImage* image) {
        const bool isFileMapping = backed.backing != Backing::anonymous;
        const OwnershipQuestion question = {.vma = backed.vma,
                                            .isFileMapping = isFileMapping,
                                            .pageSize = _context.pageSize,
                                            .isAlone = !_owner.family};
        if (backed.backing != Backing::special && needsOwnershipRuns(question)) {
            const auto runs =
                ownershipRuns(question, _pages, question.isAlone ? nullptr : &_family().generations());
            _missesPages |= !runs.has_value();
            if (runs && !runs->empty()) {
                _addRuns(backed, {.tag = tag, .file = _fileOf(backed, image)}, *runs);
                _partOfFamilyMemory += _partOf(backed, *runs);
                return;
            }
        }
        _addWhole(backed, tag);
    }

    uint64_t partOfFamilyMemory() const { return _partOfFamilyMemory; }
    bool missesPages() const { return _missesPages; }

private:
    /// What tells the memory of one window apart: each use of it has a name of its own, so it is an object of
    /// its own. A file's memory is named for the file, its data apart from its constants, and not by the tag,
    /// which can differ within it.
    struct Use {
        uint32_t tag;
        uint64_t file;
    };

    // The file's identity; 0 for memory of no file.
    uint64_t _fileOf(const BackedVma& backed, const LinuxImage* image) const {
        if (image != nullptr) {
            return _context.identity.file(image->device, image->inode);
        }
        const Vma& vma = backed.vma;
        return backed.backing == Backing::anonymous ? 0 : _context.identity.file(vma.device(), vma.inode);
    }

    ForkFamily& _family() {
        if (_knownFamily == nullptr) {
            _knownFamily = &_owner.family();
        }
        return *_knownFamily;
    }

    void _place(AddressSpaceRegion& region, const ObjectPlace& place) const {
        region.info.object_id_full = place.identifier;
        region.info.object_id = static_cast<uint32_t>(place.identifier);
        region.info.offset = place.offset;
    }

    void _addWhole(const BackedVma& backed, uint32_t tag) {
        Vma& vma = backed.vma;
        AddressSpaceRegion region = {.start = vma.start,
                                     .size = vma.size(),
                                     .info = infoFor(backed, _context.pageSize),
                                     .backing = backed.backing};
        region.info.user_tag = tag;
        _place(region, placeOf(backed, _owner, _context.identity));
        region.lazilyFreedBytes = vma.lazyFree;
        if (backed.backing == Backing::file) {
            region.dirtyFileBytes = dirtyFileBytes(vma);
            region.path = std::move(vma.path);
        }
        _regions.push_back(std::move(region));
    }

    // The kernel takes lazily freed pages from all who share them. How many of a mapping's lazily freed pages
    // and of its dirty file pages lie in which run is not known; the first runs are taken.
    void _addRuns(const BackedVma& backed, const Use& use, const std::vector<OwnershipRun>& runs) {
        uint64_t lazilyFreed = backed.vma.lazyFree / _context.pageSize;
        uint64_t dirtyFile = dirtyFileBytes(backed.vma) / _context.pageSize;
        for (const OwnershipRun& run : runs) {
            _regions.push_back(_regionOfRun(backed, use, run));
            const bool isObject = run.owner == PageOwner::object;
            _count(_regions.back(), run,
                   {.reusable = isWritten(run.owner) ? takeUpTo(lazilyFreed, run.resident) : 0,
                    .dirtyFile = isObject ? takeUpTo(dirtyFile, run.resident) : 0});
        }
    }

    // What the mapping's proportional counts hold beside the process's own pages. The counts of a file's
    // mapping hold the file's pages too, so they tell nothing.
    uint64_t _partOf(const BackedVma& backed, const std::vector<OwnershipRun>& runs) const {
        if (backed.backing != Backing::anonymous) {
            return 0;
        }
        uint64_t own = 0;
        for (const OwnershipRun& run : runs) {
            own += run.owner == PageOwner::process ? (run.resident + run.swapped) * _context.pageSize : 0;
        }
        const uint64_t proportional = backed.vma.pss + backed.vma.swapPss;
        return proportional - std::min(own, proportional);
    }

    struct PageKinds {
        uint64_t reusable;
        uint64_t dirtyFile;
    };
    void _count(AddressSpaceRegion& region, const OwnershipRun& run, PageKinds kinds) const {
        const bool onlySwapTakes = isWritten(run.owner) || region.backing != Backing::file;
        region.info.pages_resident = static_cast<uint32_t>(run.resident);
        region.info.pages_swapped_out = static_cast<uint32_t>(run.swapped);
        region.info.pages_reusable = static_cast<uint32_t>(kinds.reusable);
        region.info.pages_dirtied =
            static_cast<uint32_t>(onlySwapTakes ? run.resident - kinds.reusable : kinds.dirtyFile);
        region.lazilyFreedBytes = kinds.reusable * _context.pageSize;
        region.dirtyFileBytes = kinds.dirtyFile * _context.pageSize;
        if (run.grouped && !_isUniform(region)) {
            region.info.share_mode = SM_PRIVATE_ALIASED;
        }
    }

    // Of one kind of pages throughout, so that nobody will look at its pages one by one: those at the
    // addresses of a grouped run are not its own.
    static bool _isUniform(const AddressSpaceRegion& region) {
        const vm_region_submap_info_64& info = region.info;
        const uint32_t most = std::max(info.pages_resident, info.pages_swapped_out);
        const bool oneDirtiness =
            info.pages_reusable == 0 && (info.pages_dirtied == 0 || info.pages_dirtied == most);
        return info.pages_resident + info.pages_swapped_out == most && oneDirtiness;
    }

    AddressSpaceRegion _regionOfRun(const BackedVma& backed, const Use& use, const OwnershipRun& run) {
        AddressSpaceRegion region = {.start = run.start,
                                     .size = run.size(),
                                     .info = infoFor(backed, _context.pageSize),
                                     .backing = backed.backing};
        region.info.user_tag = use.tag;
        region.info.share_mode = _shareModeOfRun(run.owner);
        region.info.pages_resident = region.info.pages_dirtied = 0;
        region.info.pages_swapped_out = region.info.pages_reusable = 0;
        _place(region, _placeOfRun(backed.vma, use, run));
        if (backed.backing == Backing::file) {
            region.path = backed.vma.path;
        }
        return region;
    }

    static uint8_t _shareModeOfRun(PageOwner owner) {
        if (owner == PageOwner::none) {
            return SM_EMPTY;
        }
        return owner == PageOwner::process ? SM_PRIVATE : SM_COW;
    }

    ObjectPlace _placeOfRun(const Vma& vma, const Use& use, const OwnershipRun& run) {
        switch (run.owner) {
            case PageOwner::none:
                return {};
            case PageOwner::process:
                return {_context.identity.process(_owner.pid, _owner.startTime, vma.start),
                        run.start - vma.start};
            case PageOwner::object:
                return {_context.identity.file(vma.device(), vma.inode),
                        vma.offset + (run.start - vma.start)};
            case PageOwner::family:
                break;
        }
        const uint64_t window = run.start / MWFamilyWindow * MWFamilyWindow;
        return {
            _context.identity.family(
                {.family = _family().identifier(),
                 .window = window,
                 .file = use.file == 0 ? 0 : use.file + (vma.writable ? 1 : 0),
                 .tag = use.file == 0 ? _context.names.lastingNumber(use.tag, _context.identity) : MWTagNone,
                 .generation = run.generation}),
            run.start};
    }

    const AddressSpaceOwner& _owner;
    PageSource& _pages;
    const AddressSpaceContext& _context;
    std::vector<AddressSpaceRegion>& _regions;
    ForkFamily* _knownFamily = nullptr;
    uint64_t _partOfFamilyMemory = 0;
    bool _missesPages = false;
};

}  // namespace

bool isSysVSegment(const Vma& vma) {
    return vma.path.starts_with("/SYSV");
}

Backing backingOf(const Vma& vma, ShmemDevices& shmemDevices, int processDirectory) {
    const std::string_view path = vma.path;
    if (vma.has(procfs::VmFlagHugetlb)) {
        return Backing::hugetlb;
    }
    // Memory of a device, wherever its node lies: /dev can be a tmpfs.
    if (vma.has(procfs::VmFlagIo) || vma.has(procfs::VmFlagPfnMap)) {
        return Backing::special;
    }
    if (path.empty() || startsWithAny(path, {"[heap]", "[stack", "[anon:"}) ||
        (path == "/dev/zero" && !vma.shared)) {
        return Backing::anonymous;
    }
    if (isSysVSegment(vma) || startsWithAny(path, {"/memfd:", "[anon_shmem:", "/secretmem"})) {
        return Backing::shmem;
    }
    if (!path.starts_with('/')) {
        return Backing::special;
    }
    if (shmemDevices.isShmem(vma.device(), processDirectory)) {
        return Backing::shmem;
    }
    return startsWithAny(path, {"/dev/", "/dmabuf:", "/[aio]", "/proc/", "/sys/"}) ? Backing::special
                                                                                   : Backing::file;
}

namespace {

bool isSamePlainFile(const BackedVma& before, const Vma& vma) {
    constexpr uint32_t kOfTheMapping = procfs::VmFlagHugetlb | procfs::VmFlagIo | procfs::VmFlagPfnMap;
    return before.backing == Backing::file && before.vma.inode == vma.inode &&
           before.vma.device() == vma.device() && before.vma.path == vma.path &&
           (vma.flags & kOfTheMapping) == 0;
}

}  // namespace

std::vector<BackedVma> backedVmas(std::vector<Vma>& vmas, ShmemDevices& shmemDevices, int processDirectory) {
    std::vector<BackedVma> backed;
    backed.reserve(vmas.size());
    for (Vma& vma : vmas) {
        // The parts of one library follow each other.
        const bool goesOn = !backed.empty() && isSamePlainFile(backed.back(), vma);
        const Backing backing = goesOn ? Backing::file : backingOf(vma, shmemDevices, processDirectory);
        backed.push_back({vma, backing});
    }
    return backed;
}

AddressSpace::AddressSpace(const std::vector<BackedVma>& backed, const AddressSpaceOwner& owner,
                           PageSource& pages, const AddressSpaceContext& context) {
    LinuxImages images = imagesOfVmas(backed);
    const std::vector<uint32_t> tags = tagsForVmas(backed, images, context.names);
    _regions.reserve(backed.size());
    MWUseLargePages(_regions.data(), backed.size() * sizeof(AddressSpaceRegion));
    RegionBuilder builder(owner, pages, context, _regions);
    for (size_t index = 0; index < backed.size(); ++index) {
        const size_t image = images.imageOfVma[index];
        builder.add(backed[index], tags[index],
                    image == LinuxImages::kNoImage ? nullptr : &images.images[image]);
    }
    _images = std::move(images.images);
    _partOfFamilyMemory = builder.partOfFamilyMemory();
    _missesPages = builder.missesPages();
}

const AddressSpaceRegion* AddressSpace::regionAtOrAbove(uint64_t address) const {
    const auto found = std::partition_point(_regions.begin(), _regions.end(),
                                            [=](const auto& region) { return region.end() <= address; });
    return found == _regions.end() ? nullptr : &*found;
}

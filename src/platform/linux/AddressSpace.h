#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/MWHostRecords.h"
#include "platform/linux/ForkFamily.h"
#include "platform/linux/LinuxImages.h"
#include "platform/linux/ObjectIdentity.h"
#include "platform/linux/OwnershipRuns.h"
#include "platform/linux/RegionNames.h"
#include "platform/linux/RegionTags.h"
#include "platform/linux/ShmemDevices.h"

/// Which process an address space belongs to, as far as the identity of its memory depends on it.
struct AddressSpaceOwner {
    int32_t pid = 0;
    uint64_t startTime = 0;  ///< clock ticks since boot: with the pid it names one process of this boot
    uint64_t ipcNamespace = 0;
    /// Its fork family, asked for only where memory is shared by fork; none where nobody else of it is
    /// measured.
    std::function<ForkFamily&()> family;
};

/// What all the processes of a run share.
struct AddressSpaceContext {
    const ObjectIdentity& identity;
    ShmemDevices& shmemDevices;
    RegionNames& names;
    uint64_t pageSize;
};

/// One region of an address space, as the host reports it.
struct AddressSpaceRegion {
    uint64_t start = 0;
    uint64_t size = 0;
    vm_region_submap_info_64 info;
    Backing backing = Backing::anonymous;
    std::string path = {};          ///< of a mapped file; empty for everything else
    uint64_t dirtyFileBytes = 0;    ///< page-cache pages of this mapping that are dirty
    uint64_t lazilyFreedBytes = 0;  ///< given up with MADV_FREE and not yet taken

    uint64_t end() const { return start + size; }
    /// Holes are worth asking the kernel for.
    bool isSparse(uint64_t pageSize) const {
        constexpr uint64_t kSparse = 8;
        const uint64_t pages = uint64_t{info.pages_resident} + info.pages_swapped_out;
        return pages * pageSize < size / kSparse;
    }
};

/// One consistent look at a process's mappings, turned into regions: ascending, without overlap, none empty.
/// A mapping is one region, unless its pages have different owners: then each run of one owner is. Built from
/// the mappings with their counts, and their pages; immutable afterwards.
class AddressSpace {
public:
    /// Takes the mappings' paths.
    AddressSpace(const std::vector<BackedVma>& backed, const AddressSpaceOwner& owner, PageSource& pages,
                 const AddressSpaceContext& context);

    const std::vector<AddressSpaceRegion>& regions() const { return _regions; }
    /// The program and its libraries, ascending by base address.
    const std::vector<LinuxImage>& images() const { return _images; }
    /// The process's part of the memory that its fork family shares, in bytes, each divided by the number of
    /// processes that map it; 0 when it shares none.
    uint64_t partOfFamilyMemory() const { return _partOfFamilyMemory; }
    /// Whether pages of a mapping that needs a look at them could not be read: it is one region then, in
    /// whole the process's own.
    bool missesPages() const { return _missesPages; }
    /// The region that holds `address`, else the first above it, else none. Costs a binary search.
    const AddressSpaceRegion* regionAtOrAbove(uint64_t address) const;

private:
    std::vector<AddressSpaceRegion> _regions;
    std::vector<LinuxImage> _images;
    uint64_t _partOfFamilyMemory = 0;
    bool _missesPages = false;
};

/// Whether it maps a SysV segment, which only its path tells, never inode 0: its inode is the segment's id.
bool isSysVSegment(const procfs::Vma& vma);

/// The mappings, to which the answer refers, with what backs them; see backingOf.
std::vector<BackedVma> backedVmas(std::vector<procfs::Vma>& vmas, ShmemDevices& shmemDevices,
                                  int processDirectory);

/// Everything that a mapping's path, flags and device tell of its backing.
Backing backingOf(const procfs::Vma& vma, ShmemDevices& shmemDevices, int processDirectory);

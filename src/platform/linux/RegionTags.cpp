#include "platform/linux/RegionTags.h"

#include <array>
#include <span>
#include <string_view>

#include "platform/MWRegionTags.h"
#include "platform/linux/AnonymousTags.h"

namespace {

using procfs::Vma;

struct PathTag {
    std::string_view prefix;
    uint32_t tag;
};

uint32_t tagForPath(std::string_view path, std::span<const PathTag> table, uint32_t otherwise) {
    for (const PathTag& entry : table) {
        if (path.starts_with(entry.prefix)) {
            return entry.tag;
        }
    }
    return otherwise;
}

constexpr std::array kSpecialPaths = {
    PathTag{"[vdso]", MWTagVdso},
    PathTag{"[vvar_vclock]", MWTagVvarClock},
    PathTag{"[vvar", MWTagVvar},
    PathTag{"[vsyscall]", MWTagVsyscall},
    PathTag{"[uprobes]", MWTagUprobes},
    PathTag{"anon_inode:[io_uring]", MWTagIoUring},
    PathTag{"anon_inode:[perf_event]", MWTagPerf},
    PathTag{"anon_inode:kvm", MWTagKvm},
    PathTag{"anon_inode:[kvm", MWTagKvm},
    PathTag{"anon_inode:bpf-map", MWTagBpf},
    PathTag{"anon_inode:[vfio", MWTagVfio},
    PathTag{"anon_inode:", MWTagAnonInode},
    PathTag{"/[aio]", MWTagAio},
    PathTag{"/dev/dri/", MWTagDrm},
    PathTag{"/dev/nvidia", MWTagNvidia},
    PathTag{"/dev/kfd", MWTagKfd},
    PathTag{"/dev/accel/", MWTagAccelerator},
    PathTag{"/dev/video", MWTagVideo},
    PathTag{"/dev/snd/", MWTagSound},
    PathTag{"/dev/fb", MWTagFramebuffer},
    PathTag{"/dev/infiniband/", MWTagInfiniband},
    PathTag{"/dev/vfio/", MWTagVfio},
    PathTag{"/dev/uio", MWTagUio},
    PathTag{"/dev/mem", MWTagPhysicalMemory},
    PathTag{"/dev/bus/usb/", MWTagUsb},
    PathTag{"/dev/binder", MWTagBinder},
    PathTag{"/dev/ashmem", MWTagAshmem},
    PathTag{"/dev/mali", MWTagVendorGpu},
    PathTag{"/dev/kgsl", MWTagVendorGpu},
    PathTag{"/dev/dxg", MWTagVendorGpu},
    PathTag{"/dev/xen/", MWTagXen},
    PathTag{"/dev/dax", MWTagDax},
    PathTag{"/dev/sgx", MWTagSgx},
    PathTag{"/dmabuf:", MWTagDmaBuffer},
    PathTag{"socket:", MWTagPacketRing},
    PathTag{"/dev/", MWTagOtherDevice},
    PathTag{"/proc/bus/pci/", MWTagPciDevice},
    PathTag{"/sys/bus/pci/", MWTagPciDevice},
    PathTag{"/sys/devices/pci", MWTagPciDevice},
    PathTag{"/sys/kernel/tracing/", MWTagTraceBuffer},
    PathTag{"/sys/kernel/debug/tracing/", MWTagTraceBuffer},
    PathTag{"/proc/", MWTagProcFile},
    PathTag{"/sys/", MWTagProcFile},
};

constexpr std::array kShmemPaths = {
    PathTag{"/SYSV", MWTagSysV},
    PathTag{"/memfd:java_heap", MWTagJavaHeap},
    PathTag{"/memfd:", MWTagMemfd},
    PathTag{"/dev/shm/PostgreSQL.", MWTagPostgres},
    PathTag{"/dev/shm/", MWTagPosixShm},
    PathTag{"/dev/zero", MWTagSharedAnonymous},
    PathTag{"/secretmem", MWTagSecretMemory},
    PathTag{"/drm mm object", MWTagDrm},
};

constexpr std::array kHugetlbPaths = {
    PathTag{"/anon_hugepage", MWTagHugetlb},
    PathTag{"/SYSV", MWTagHugetlbSysV},
    PathTag{"/memfd:", MWTagHugetlbMemfd},
};

// Names that the C library gives (glibc.mem.decorate_maps, since 2.39) to kinds of memory that have a tag. A
// stack's name ends in its thread: a tag for each would soon use up all there are.
constexpr std::array kLibraryNames = {
    PathTag{" glibc: malloc arena", MWTagMallocArena},
    PathTag{" glibc: malloc", MWTagMallocLarge},
    PathTag{" glibc: loader malloc", MWTagLoaderHeap},
    PathTag{" glibc: pthread stack", MWTagThreadStack},
    PathTag{" glibc: pthread user stack", MWTagThreadStack},
};

// "[anon:NAME]" and "[anon_shmem:NAME]": what a program says of its own memory beats any guess.
std::string_view givenName(std::string_view path) {
    for (const std::string_view prefix : {"[anon:", "[anon_shmem:"}) {
        if (path.starts_with(prefix) && path.ends_with(']')) {
            return path.substr(prefix.size(), path.size() - prefix.size() - 1);
        }
    }
    return {};
}

uint32_t tagForGivenName(std::string_view name, RegionNames& names) {
    const uint32_t known = tagForPath(name, kLibraryNames, MWTagNone);
    return known != MWTagNone ? known : names.tagForName(name);
}

uint32_t tagForShmem(const Vma& vma) {
    return vma.executable ? MWTagSharedCode : tagForPath(vma.path, kShmemPaths, MWTagTmpfs);
}

uint32_t tagForHugetlb(const Vma& vma) {
    const uint32_t tag = tagForPath(vma.path, kHugetlbPaths, MWTagHugetlbFile);
    return tag == MWTagHugetlb && vma.shared ? MWTagHugetlbShared : tag;
}

// Packet sockets and TCP are mapped at offset 0, the rings of an XDP socket from 2 GiB on, but for the first.
uint32_t tagForSpecial(const Vma& vma) {
    constexpr uint64_t kSecondXdpRing = 0x80000000;
    const uint32_t tag = tagForPath(vma.path, kSpecialPaths, MWTagNone);
    return tag == MWTagPacketRing && vma.offset >= kSecondXdpRing ? MWTagXdp : tag;
}

}  // namespace

std::vector<uint32_t> tagsForVmas(const std::vector<BackedVma>& vmas, const LinuxImages& images,
                                  RegionNames& names) {
    const AnonymousTagger anonymous(vmas, images);
    const auto tagOf = [&](size_t index) -> uint32_t {
        const auto& [vma, backing] = vmas[index];
        if (const std::string_view name = givenName(vma.path); !name.empty()) {
            return tagForGivenName(name, names);
        }
        switch (backing) {
            case Backing::anonymous:
                return anonymous.tag(index);
            case Backing::shmem:
                return tagForShmem(vma);
            case Backing::hugetlb:
                return tagForHugetlb(vma);
            case Backing::special:
                return tagForSpecial(vma);
            case Backing::file:
                break;
        }
        return MWTagNone;
    };
    std::vector<uint32_t> tags;
    tags.reserve(vmas.size());
    for (size_t index = 0; index < vmas.size(); ++index) {
        tags.push_back(tagOf(index));
    }
    return tags;
}

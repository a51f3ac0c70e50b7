#include "platform/linux/RegionTags.h"

#include <array>
#include <span>
#include <string_view>
#include <utility>

#include "platform/MWRegionTags.h"

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
    PathTag{"[vvar", MWTagVvar},
    PathTag{"[vsyscall]", MWTagVsyscall},
    PathTag{"[uprobes]", MWTagUprobes},
    PathTag{"anon_inode:[io_uring]", MWTagIoUring},
    PathTag{"anon_inode:[perf_event]", MWTagPerf},
    PathTag{"anon_inode:kvm", MWTagKvm},
    PathTag{"anon_inode:bpf-map", MWTagBpf},
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
    PathTag{"/dev/sgx", MWTagSgx},
    PathTag{"/dmabuf:", MWTagDmaBuffer},
    PathTag{"socket:", MWTagPacketRing},
    PathTag{"/dev/", MWTagOtherDevice},
};

constexpr std::array kShmemPaths = {
    PathTag{"/SYSV", MWTagSysV},
    PathTag{"/memfd:", MWTagMemfd},
    PathTag{"/dev/shm/", MWTagPosixShm},
    PathTag{"/dev/zero", MWTagSharedAnonymous},
    PathTag{"/secretmem", MWTagSecretMemory},
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

bool isInaccessible(const Vma& vma) {
    return !vma.readable && !vma.writable && !vma.executable;
}

/// Tags anonymous memory by what stands beside it.
class AnonymousTagger {
public:
    explicit AnonymousTagger(const std::vector<BackedVma>& vmas) : _vmas(vmas) {}

    uint32_t tag(size_t index) const {
        const Vma& vma = _vmas[index].vma;
        if (vma.path == "[heap]") {
            return MWTagBrkHeap;
        }
        if (vma.path.starts_with("[stack")) {
            return MWTagMainStack;
        }
        if (isInaccessible(vma)) {
            return _tagOfInaccessible(index);
        }
        if (vma.executable) {
            return MWTagJitCode;
        }
        if (_isArena(index)) {
            return MWTagMallocArena;
        }
        return _isThreadStack(index) ? MWTagThreadStack : MWTagNone;
    }

private:
    static constexpr uint64_t kArenaSize = 64ULL << 20U;
    static constexpr uint64_t kLargestGuard = 1ULL << 20U;

    bool _isAnonymous(size_t index) const { return _vmas[index].backing == Backing::anonymous; }

    // A mapping that begins where the one before it ends.
    bool _follows(size_t index) const {
        return index > 0 && _vmas[index - 1].vma.end == _vmas[index].vma.start && _isAnonymous(index - 1);
    }

    // A heap of the C library's further arenas begins at a multiple of 64 MiB; what is not used yet of the
    // 64 MiB stands behind it, inaccessible.
    bool _isArena(size_t index) const {
        const Vma& vma = _vmas[index].vma;
        if (vma.start % kArenaSize != 0 || vma.size() > kArenaSize || !vma.writable) {
            return false;
        }
        if (vma.size() == kArenaSize) {
            return true;
        }
        const size_t next = index + 1;
        return next < _vmas.size() && _follows(next) && isInaccessible(_vmas[next].vma) &&
               _vmas[next].vma.end == vma.start + kArenaSize;
    }

    // A thread's stack lies above its guard. MAP_STACK shows as "nh" since Linux 6.7; before that the guard
    // is all there is to tell by.
    bool _isThreadStack(size_t index) const {
        const Vma& vma = _vmas[index].vma;
        if (!vma.writable || !_follows(index) || !_isGuard(index - 1)) {
            return false;
        }
        constexpr uint64_t kSmallestStack = 64ULL << 10U;
        return vma.has(procfs::VmFlagNoHugepage) || vma.size() >= kSmallestStack;
    }

    bool _isGuard(size_t index) const {
        const Vma& vma = _vmas[index].vma;
        return isInaccessible(vma) && vma.size() <= kLargestGuard;
    }

    uint32_t _tagOfInaccessible(size_t index) const {
        if (_follows(index) && _isArena(index - 1)) {
            return MWTagMallocReserve;
        }
        const size_t next = index + 1;
        if (_isGuard(index) && next < _vmas.size() && _follows(next) && _isThreadStack(next)) {
            return MWTagStackGuard;
        }
        return MWTagGuard;
    }

    const std::vector<BackedVma>& _vmas;
};

uint32_t tagForBacking(const BackedVma& backed) {
    switch (backed.backing) {
        case Backing::shmem:
            return tagForPath(backed.vma.path, kShmemPaths, MWTagTmpfs);
        case Backing::hugetlb:
            return tagForPath(backed.vma.path, std::array{PathTag{"/anon_hugepage", MWTagHugetlb}},
                              MWTagHugetlbFile);
        case Backing::special: {
            const uint32_t otherwise =
                backed.vma.path.starts_with("anon_inode:") ? MWTagAnonInode : MWTagNone;
            return tagForPath(backed.vma.path, kSpecialPaths, otherwise);
        }
        case Backing::anonymous:
        case Backing::file:
            break;
    }
    return MWTagNone;
}

}  // namespace

std::vector<uint32_t> tagsForVmas(const std::vector<BackedVma>& vmas, RegionNames& names) {
    const AnonymousTagger anonymous(vmas);
    std::vector<uint32_t> tags;
    tags.reserve(vmas.size());
    for (size_t index = 0; index < vmas.size(); ++index) {
        const std::string_view name = givenName(vmas[index].vma.path);
        if (!name.empty()) {
            tags.push_back(names.tagForName(name));
        } else if (vmas[index].backing == Backing::anonymous) {
            tags.push_back(anonymous.tag(index));
        } else {
            tags.push_back(tagForBacking(vmas[index]));
        }
    }
    return tags;
}

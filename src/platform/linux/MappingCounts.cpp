#include "platform/linux/MappingCounts.h"

#include <algorithm>
#include <array>
#include <string_view>

#include "platform/linux/AnonymousTags.h"
#include "platform/linux/LinuxImages.h"

namespace {

using procfs::Vma;

constexpr std::array<std::string_view, 4> kUnderstoodSpecials = {"[vdso]", "[vvar]", "[vvar_vclock]",
                                                                 "[vsyscall]"};

bool isUnderstoodSpecial(const Vma& vma) {
    return std::ranges::find(kUnderstoodSpecials, vma.path) != kUnderstoodSpecials.end();
}

// A device, wherever its memory comes from.
bool isDevicePath(std::string_view path) {
    return path.starts_with("/dev/") && !path.starts_with("/dev/shm/") && path != "/dev/zero";
}

/// What is known of a mapping before its pages are looked at.
bool canBeCounted(const BackedVma& backed, bool swapInUse) {
    const Vma& vma = backed.vma;
    switch (backed.backing) {
        case Backing::anonymous:
            return true;
        case Backing::file:
            return !isDevicePath(vma.path) && !(vma.shared && vma.writable);
        case Backing::shmem:
            return !isDevicePath(vma.path) && !swapInUse;
        case Backing::special:
            return isUnderstoodSpecial(vma);
        case Backing::hugetlb:
            break;
    }
    return false;
}

bool canBeCounted(const std::vector<BackedVma>& vmas, const procfs::ProcStatus& status, bool swapInUse) {
    const bool plain = status.vmLck == 0 && status.hugetlbPages == 0 && !status.hasShadowStack;
    return plain && !anonymousTagsNeedFlags(vmas) &&
           std::ranges::all_of(vmas, [=](const auto& backed) { return canBeCounted(backed, swapInUse); });
}

// Entries that stand for no page (guards made by madvise, pages on the move) look like swapped ones.
bool agreesOnSwap(const std::vector<BackedVma>& vmas, uint64_t swapped) {
    for (const BackedVma& backed : vmas) {
        if (backed.vma.swap > swapped) {
            return false;
        }
        swapped -= backed.vma.swap;
    }
    return swapped == 0;
}

bool hasFilePages(const BackedVma& backed) {
    return backed.backing == Backing::file && backed.vma.rss > backed.vma.anonymous;
}

/// Looks for pages that another process maps as well, of which one is enough.
class SharedPageFinder {
public:
    SharedPageFinder(PageSource& pages, uint64_t pageSize) : _pages(pages), _pageSize(pageSize) {}

    /// Marks the mapping where it finds one; false when its pages cannot be read any more.
    bool mark(Vma& vma) {
        for (uint64_t start = vma.start; start < vma.end;) {
            start = _pages.nextPopulated(start, vma.end);
            _entries.resize(std::min(kPagesAtOnce, (vma.end - start) / _pageSize));
            if (!_entries.empty() && !_pages.readPages(start, _entries)) {
                return false;
            }
            if (std::ranges::any_of(_entries, isShared)) {
                vma.sharedDirty = _pageSize;
                return true;
            }
            start += _entries.size() * _pageSize;
        }
        return true;
    }

private:
    static constexpr uint64_t kPagesAtOnce = 4096;

    static bool isShared(PagemapEntry entry) {
        return entry.present() && !entry.fileOrShared() && !entry.exclusive();
    }

    PageSource& _pages;
    uint64_t _pageSize;
    std::vector<PagemapEntry> _entries;
};

bool markShared(std::vector<BackedVma>& vmas, const CountedProcess& process) {
    SharedPageFinder finder(process.pages, process.pageSize);
    return std::ranges::all_of(vmas, [&](BackedVma& backed) {
        return backed.vma.swap == 0 && (backed.vma.anonymous == 0 || finder.mark(backed.vma));
    });
}

}  // namespace

std::optional<std::vector<ScannedRange>> countWithoutSmaps(std::vector<BackedVma>& vmas,
                                                           const CountedProcess& process,
                                                           UncountedPages& uncounted) {
    if (uncounted.canBeInAnonymousMemory() || !canBeCounted(vmas, process.status, uncounted.isSwapInUse())) {
        return std::nullopt;
    }
    auto filePages = countPages(vmas, process.scan);
    const Vma* lastClean = nullptr;
    const auto isClean = [&](const BackedVma& backed) {
        const Vma& vma = backed.vma;
        const bool goesOn =
            lastClean != nullptr && lastClean->inode == vma.inode && lastClean->device() == vma.device();
        if (!hasFilePages(backed) || goesOn) {
            return true;
        }
        lastClean = &vma;
        return uncounted.isCleanFile(process.memoryDirectory, vma);
    };
    if (!filePages || !agreesOnSwap(vmas, process.status.vmSwap) || imagesNeedFlags(vmas) ||
        !std::ranges::all_of(vmas, isClean)) {
        return std::nullopt;
    }
    return process.isAlone || markShared(vmas, process) ? std::move(filePages) : std::nullopt;
}

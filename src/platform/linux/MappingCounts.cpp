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

bool areFilesClean(const std::vector<BackedVma>& vmas, int memoryDirectory, UncountedPages& uncounted) {
    const Vma* lastClean = nullptr;
    return std::ranges::all_of(vmas, [&](const BackedVma& backed) {
        const Vma& vma = backed.vma;
        const bool goesOn =
            lastClean != nullptr && lastClean->inode == vma.inode && lastClean->device() == vma.device();
        if (!hasFilePages(backed) || goesOn) {
            return true;
        }
        lastClean = &vma;
        return uncounted.isCleanFile(memoryDirectory, vma);
    });
}

/// What smaps tells of all the mappings together, read when it is first asked for.
class Sums {
public:
    Sums(const std::vector<BackedVma>& vmas, const CountedProcess& process, bool swapInUse)
        : _process(process), _mappings(vmas.size()), _swapInUse(swapInUse) {}

    bool tellOneKindOfAnonymousMemory() { return _read() && _sums->lazyFree + _sums->ksm == 0; }

    // The kernel leaves a page of the arguments on the stack clean, so that one dirty page of a file would
    // not show. Read back from swap any page can be clean.
    bool tellCleanFiles() {
        return !_swapInUse && _read() && _sums->sharedDirty + _sums->privateDirty <= _sums->anonymous;
    }

private:
    /// False where the kernel does not tell, or takes about as long for it as for smaps.
    bool _read() {
        std::vector<Vma> sums;
        if (!_wasAsked && _payOff() && procfs::readMappings(_process.memoryDirectory, "smaps_rollup", sums) &&
            sums.size() == 1 && sums.front().hasCounts) {
            _sums = std::move(sums.front());
        }
        _wasAsked = true;
        return _sums.has_value();
    }

    // A mapping's lines in smaps cost as much as looking at 240 pages once more does.
    bool _payOff() const {
        constexpr uint64_t kPagesWorthAMapping = 128;
        const procfs::ProcStatus& status = _process.status;
        const uint64_t resident = status.rssAnon + status.rssFile + status.rssShmem;
        return resident / _process.pageSize < _mappings * kPagesWorthAMapping;
    }

    const CountedProcess& _process;
    size_t _mappings;
    bool _swapInUse;
    bool _wasAsked = false;
    std::optional<Vma> _sums;
};

}  // namespace

// What holds for the whole system is asked for each process only where it does not hold.
std::optional<std::vector<ScannedRange>> countWithoutSmaps(std::vector<BackedVma>& vmas,
                                                           const CountedProcess& process,
                                                           UncountedPages& uncounted) {
    const bool swapInUse = uncounted.isSwapInUse();
    const bool isUniform = !uncounted.canBeInAnonymousMemory();
    Sums sums(vmas, process, swapInUse);
    if (!canBeCounted(vmas, process.status, swapInUse) ||
        !(isUniform || sums.tellOneKindOfAnonymousMemory())) {
        return std::nullopt;
    }
    auto filePages = countPages(vmas, process.scan);
    if (!filePages || !agreesOnSwap(vmas, process.status.vmSwap) || imagesNeedFlags(vmas)) {
        return std::nullopt;
    }
    const bool isClean = areFilesClean(vmas, process.memoryDirectory, uncounted) || sums.tellCleanFiles();
    return isClean && (process.isAlone || markShared(vmas, process)) ? std::move(filePages) : std::nullopt;
}

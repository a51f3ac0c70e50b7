#include "platform/linux/OwnershipRuns.h"

#include <algorithm>
#include <numeric>
#include <utility>

namespace {

constexpr uint64_t kMostRuns = 1024;

/// Owner and generation of one page.
struct Ownership {
    PageOwner owner = PageOwner::none;
    uint32_t generation = 0;

    bool operator==(const Ownership&) const = default;
};

Ownership ownershipOf(const OwnershipRun& run) {
    return {run.owner, run.generation};
}

// Swapped pages do not say whether they are shared. The mapping's counts do, all together: with some shared
// all count as shared, since what a family's generations find different they keep apart anyway.
bool swapIsShared(const procfs::Vma& vma) {
    return vma.swapPss < vma.swap;
}

/// Makes runs of one mapping, window by window.
class RunMaker {
public:
    RunMaker(const OwnershipQuestion& question, FrameGenerations* generations)
        : _question(question), _generations(generations), _runsForAWindow(runsForAWindow(question.vma)) {}

    /// The pages of [start, start + entries), which lie in one window; ascending without a gap.
    void addWindow(uint64_t start, std::span<const PagemapEntry> entries) {
        _ownerships.assign(entries.size(), {});
        for (size_t page = 0; page < entries.size(); ++page) {
            _ownerships[page] = _ownership(entries[page]);
        }
        _assignGenerations(start, entries);
        _fillAbsent();
        _splitIntoRuns(start, entries);
        if (_window.size() > _runsForAWindow) {
            _groupByOwner(start);
        }
        _appendWindow();
    }

    /// A stretch without any page.
    void addNothing(uint64_t start, uint64_t end) {
        _window.assign(1, {.start = start, .end = end});
        _appendWindow();
    }

    uint64_t resident() const { return _total(&OwnershipRun::resident); }

    std::vector<OwnershipRun> finish() {
        const auto hasOwner = [](const OwnershipRun& run) { return run.owner != PageOwner::none; };
        if (std::none_of(_runs.begin(), _runs.end(), hasOwner)) {
            return {};
        }
        _reconcile(&OwnershipRun::resident, _question.vma.resident() / _question.pageSize);
        _reconcile(&OwnershipRun::swapped, _question.vma.swap / _question.pageSize);
        return std::move(_runs);
    }

private:
    static uint64_t runsForAWindow(const procfs::Vma& vma) {
        const uint64_t windows = (vma.end - 1) / MWFamilyWindow - vma.start / MWFamilyWindow + 1;
        return std::max(uint64_t{2}, kMostRuns / windows);
    }

    Ownership _ownership(PagemapEntry entry) const {
        if (entry.swapped()) {
            return {_ownerOf(!swapIsShared(_question.vma)), 0};
        }
        if (!entry.present()) {
            return {};
        }
        if (_question.isFileMapping && entry.fileOrShared()) {
            return {PageOwner::object, 0};
        }
        return {_ownerOf(entry.exclusive()), 0};
    }

    PageOwner _ownerOf(bool isExclusive) const {
        return isExclusive || _question.isAlone ? PageOwner::process : PageOwner::family;
    }

    void _assignGenerations(uint64_t start, std::span<const PagemapEntry> entries) {
        const uint64_t window = start / MWFamilyWindow * MWFamilyWindow;
        _framePages.clear();
        _framePositions.clear();
        for (size_t page = 0; page < entries.size(); ++page) {
            if (_ownerships[page].owner == PageOwner::family) {
                const uint64_t slot = (start - window) / _question.pageSize + page;
                _framePages.push_back({static_cast<uint32_t>(slot), entries[page].frame()});
                _framePositions.push_back(page);
            }
        }
        if (_framePages.empty()) {
            return;
        }
        _frameGenerations.resize(_framePages.size());
        _generations->assign(window, _framePages, _frameGenerations);
        for (size_t i = 0; i < _framePages.size(); ++i) {
            _ownerships[_framePositions[i]].generation = _frameGenerations[i];
        }
    }

    // Absent pages join the page before them, those at the window's beginning the first one behind them.
    void _fillAbsent() {
        const auto isPage = [](const Ownership& ownership) { return ownership.owner != PageOwner::none; };
        const auto first = std::find_if(_ownerships.begin(), _ownerships.end(), isPage);
        if (first == _ownerships.end()) {
            return;
        }
        std::fill(_ownerships.begin(), first, *first);
        for (auto page = first + 1; page < _ownerships.end(); ++page) {
            if (page->owner == PageOwner::none) {
                *page = *(page - 1);
            }
        }
    }

    void _splitIntoRuns(uint64_t start, std::span<const PagemapEntry> entries) {
        _window.clear();
        for (size_t page = 0; page < entries.size(); ++page) {
            const uint64_t address = start + page * _question.pageSize;
            if (_window.empty() || ownershipOf(_window.back()) != _ownerships[page]) {
                _window.push_back({.start = address,
                                   .end = address,
                                   .owner = _ownerships[page].owner,
                                   .generation = _ownerships[page].generation});
            }
            _window.back().end = address + _question.pageSize;
            _window.back().resident += entries[page].present() ? 1 : 0;
            _window.back().swapped += !entries[page].present() && entries[page].swapped() ? 1 : 0;
        }
    }

    // Absent pages leave their runs and come last, so that a group holds nothing but its pages.
    void _groupByOwner(uint64_t start) {
        const uint64_t end = _window.back().end;
        std::stable_sort(_window.begin(), _window.end(), [](const OwnershipRun& a, const OwnershipRun& b) {
            return std::pair(a.owner, a.generation) < std::pair(b.owner, b.generation);
        });
        std::vector<OwnershipRun> grouped;
        for (const OwnershipRun& run : _window) {
            if (grouped.empty() || ownershipOf(grouped.back()) != ownershipOf(run)) {
                const uint64_t at = grouped.empty() ? start : grouped.back().end;
                grouped.push_back({.start = at,
                                   .end = at,
                                   .owner = run.owner,
                                   .generation = run.generation,
                                   .grouped = true});
            }
            grouped.back().end += (run.resident + run.swapped) * _question.pageSize;
            grouped.back().resident += run.resident;
            grouped.back().swapped += run.swapped;
        }
        if (grouped.back().end < end) {
            grouped.push_back({.start = grouped.back().end, .end = end});
        }
        _window = std::move(grouped);
    }

    // Only a family's memory is cut at windows.
    void _appendWindow() {
        for (const OwnershipRun& run : _window) {
            if (!_runs.empty() && run.owner != PageOwner::family && _runs.back().owner == run.owner) {
                _runs.back().end = run.end;
                _runs.back().resident += run.resident;
                _runs.back().swapped += run.swapped;
            } else {
                _runs.push_back(run);
            }
        }
    }

    uint64_t _total(uint64_t OwnershipRun::*count) const {
        return std::accumulate(_runs.begin(), _runs.end(), uint64_t{0},
                               [=](uint64_t sum, const OwnershipRun& run) { return sum + run.*count; });
    }

    // At least one run has an owner; those without one have no pages and get none.
    void _reconcile(uint64_t OwnershipRun::*count, uint64_t wanted) {
        const auto isLess = [=](const OwnershipRun& a, const OwnershipRun& b) {
            return std::pair(a.owner != PageOwner::none, a.*count) <
                   std::pair(b.owner != PageOwner::none, b.*count);
        };
        for (uint64_t found = _total(count); found != wanted; found = _total(count)) {
            OwnershipRun& largest = *std::max_element(_runs.begin(), _runs.end(), isLess);
            largest.*count += found < wanted ? wanted - found : -std::min(largest.*count, found - wanted);
        }
    }

    const OwnershipQuestion& _question;
    FrameGenerations* _generations;
    uint64_t _runsForAWindow;
    std::vector<OwnershipRun> _runs;
    // Of the window at hand, kept for their storage.
    std::vector<OwnershipRun> _window;
    std::vector<Ownership> _ownerships;
    std::vector<FrameGenerations::Page> _framePages;
    std::vector<size_t> _framePositions;
    std::vector<uint32_t> _frameGenerations;
};

}  // namespace

// Anonymous memory is read where the counts show pages that others map too. Of a file's private mapping the
// written pages are told from the file's own only page by page.
bool needsOwnershipRuns(const OwnershipQuestion& question) {
    const procfs::Vma& vma = question.vma;
    if (vma.shared || vma.ksm != 0) {
        return false;
    }
    if (vma.has(procfs::VmFlagHugetlb)) {
        return vma.sharedHugetlb != 0 && vma.privateHugetlb != 0;
    }
    const bool written = vma.anonymous != 0 || vma.swap != 0;
    const bool sharesPages = vma.sharedClean + vma.sharedDirty != 0 || swapIsShared(vma);
    const bool ofFamily = !question.isAlone && sharesPages;
    return written && (ofFamily || (question.isFileMapping && vma.anonymous < vma.rss));
}

namespace {

/// Reads a mapping's pages window by window, a few windows at a time.
class WindowReader {
public:
    WindowReader(const OwnershipQuestion& question, PageSource& pages, bool withoutZeroPages)
        : _vma(question.vma),
          _pageSize(question.pageSize),
          _pages(pages),
          _withoutZeroPages(withoutZeroPages),
          _isSparse((question.vma.resident() + question.vma.swap) * kSparse < question.vma.size()) {}

    /// The end of the stretch that begins at `start` and has no pages at all; `start` when there is none.
    uint64_t endOfNothing(uint64_t start) {
        if (!_isSparse || start < _readEnd) {
            return start;
        }
        const uint64_t populated = _pages.nextPopulated(start, _vma.end);
        return populated == _vma.end ? _vma.end
                                     : std::max(start, populated / MWFamilyWindow * MWFamilyWindow);
    }

    /// The words of [start, end), a window; none when they cannot be read.
    std::span<const PagemapEntry> window(uint64_t start, uint64_t end) {
        if (end > _readEnd && !_read(start)) {
            return {};
        }
        return std::span(_entries).subspan((start - _readStart) / _pageSize, (end - start) / _pageSize);
    }

private:
    static constexpr uint64_t kSparse = 8;
    static constexpr uint64_t kWindowsAtOnce = 8;

    bool _read(uint64_t start) {
        const uint64_t limit = (start / MWFamilyWindow + kWindowsAtOnce) * MWFamilyWindow;
        _readStart = start;
        _readEnd = std::min(_vma.end, limit);
        _entries.resize((_readEnd - _readStart) / _pageSize);
        if (!_pages.readPages(_readStart, _entries)) {
            return false;
        }
        if (_withoutZeroPages) {
            _pages.clearZeroPages(_readStart, _entries);
        }
        return true;
    }

    const procfs::Vma& _vma;
    uint64_t _pageSize;
    PageSource& _pages;
    bool _withoutZeroPages;
    bool _isSparse;  ///< holes are worth asking for
    uint64_t _readStart = 0;
    uint64_t _readEnd = 0;
    std::vector<PagemapEntry> _entries;
};

bool addWindows(RunMaker& maker, WindowReader& reader, const procfs::Vma& vma) {
    for (uint64_t start = vma.start; start < vma.end;) {
        const uint64_t nothing = reader.endOfNothing(start);
        if (nothing > start) {
            maker.addNothing(start, nothing);
            start = nothing;
            continue;
        }
        const uint64_t end = std::min(vma.end, (start / MWFamilyWindow + 1) * MWFamilyWindow);
        const std::span<const PagemapEntry> entries = reader.window(start, end);
        if (entries.empty()) {
            return false;
        }
        maker.addWindow(start, entries);
        start = end;
    }
    return true;
}

}  // namespace

// Asking for zero pages costs a second walk of the page tables and most mappings have none. That there are
// some shows by more pages being present than the mapping's count has.
std::optional<std::vector<OwnershipRun>> ownershipRuns(const OwnershipQuestion& question, PageSource& pages,
                                                       FrameGenerations* generations) {
    constexpr uint64_t kLargestWithoutKnowingHoles = 64ULL << 30U;
    if (question.vma.size() > kLargestWithoutKnowingHoles && !pages.knowsHoles()) {
        return std::vector<OwnershipRun>();
    }
    for (const bool withoutZeroPages : {false, true}) {
        RunMaker maker(question, generations);
        WindowReader reader(question, pages, withoutZeroPages);
        if (!addWindows(maker, reader, question.vma)) {
            return std::nullopt;
        }
        if (withoutZeroPages || maker.resident() <= question.vma.resident() / question.pageSize) {
            return maker.finish();
        }
    }
    return std::nullopt;
}

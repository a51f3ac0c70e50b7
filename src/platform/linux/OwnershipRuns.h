#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <vector>

#include "platform/linux/FrameGenerations.h"
#include "platform/linux/PagemapEntry.h"
#include "platform/linux/SmapsParser.h"

/// The pages of a process, for whoever reads them: the live process, or a test.
class PageSource {
public:
    virtual ~PageSource() = default;
    /// The pagemap words of consecutive pages; false when they cannot be read any more.
    virtual bool readPages(uint64_t address, std::span<PagemapEntry> entries) = 0;
    /// Clears the words of pages that are the zero page, which is nobody's memory.
    virtual void clearZeroPages(uint64_t address, std::span<PagemapEntry> entries) = 0;
    /// The first page in [address, end) that is present or swapped, or `end`; `address` itself where the
    /// kernel cannot say.
    virtual uint64_t nextPopulated(uint64_t address, uint64_t end) = 0;
    /// Whether `nextPopulated` can say.
    virtual bool knowsHoles() = 0;
};

/// To whom a page of a private mapping belongs.
enum class PageOwner : uint8_t {
    none,     ///< nothing is there
    object,   ///< the mapped file, still as it is in the file
    process,  ///< this process alone
    family,   ///< shared, since a fork, with processes of the same family
};

/// A span of one owner. `end` - `start` of all runs of a mapping are the mapping; counts are pages.
struct OwnershipRun {
    uint64_t start = 0;
    uint64_t end = 0;
    PageOwner owner = PageOwner::none;
    uint32_t generation = 0;  ///< of the family's frames, see FrameGenerations
    uint64_t resident = 0;
    uint64_t swapped = 0;
    bool grouped = false;  ///< the addresses stand for the pages without being theirs

    uint64_t size() const { return end - start; }
};

/// Which process looks at which mapping.
struct OwnershipQuestion {
    const procfs::Vma& vma;
    bool isFileMapping;  ///< pages can belong to an object
    uint64_t pageSize;
    /// Nobody else of its fork family is measured: written pages are the process's own, whoever maps them
    /// too.
    bool isAlone;
};

/// Whether a mapping holds pages of different owners, as far as its counts tell; reading its pages costs as
/// much as the counts did.
bool needsOwnershipRuns(const OwnershipQuestion& question);

/// The maximal spans of one owner. Absent pages go with the page before them; where a window of a family
/// (MWFamilyWindow) holds no page at all it has no owner, so that nobody looks like its sharer. Family runs
/// are cut at windows.
///
/// A mapping whose owners alternate finely (a process that rewrote every second page after fork) would make
/// a region of every page. Where a window has more runs than its part of 1024, its pages are grouped: one
/// run for each owner, with exact counts, laid out behind one another in the window's addresses.
///
/// The zero page counts as absent. Large stretches without a page are passed over without being read.
///
/// The counts of the runs add up to those of the mapping (`rss`, `swap`), which was counted a moment earlier:
/// what came or went in between is added to or taken from the largest runs. Empty when they are all gone, or
/// lie in a mapping so large that it cannot be read without knowing its holes; none when they cannot be read.
///
/// `generations` are those of the process's family, null when it is alone.
std::optional<std::vector<OwnershipRun>> ownershipRuns(const OwnershipQuestion& question, PageSource& pages,
                                                       FrameGenerations* generations);

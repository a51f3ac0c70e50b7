#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "model/MWSharedText.h"

/// Keeps one copy of each distinct text, for any number of threads and without a lock: a slot goes from empty
/// to a text once, by compare-and-swap, and never changes again. A search looks at a bounded number of slots,
/// so a full table costs further copies and never fails.
class MWInterningTable {
public:
    MWInterningTable(size_t slots, size_t mostProbes) : _mostProbes(mostProbes), _slots(slots) {}
    ~MWInterningTable();
    MWInterningTable(const MWInterningTable&) = delete;
    MWInterningTable& operator=(const MWInterningTable&) = delete;

    /// The stored text equal to `text`, which is stored if an empty slot comes first; from `firstSlot` (below
    /// the number of slots) on, around the end. A copy of its own where neither is among the slots looked at.
    /// A stored text is the table's and lives as long as it.
    MWSharedText intern(std::string_view text, size_t firstSlot = 0);

private:
    using Slot = std::atomic<const std::string*>;

    size_t _mostProbes;
    std::vector<Slot> _slots;
};

/// From the program's table of image paths. The search begins at a slot chosen by the image's address, which
/// is the same in every process where an image of the shared cache is concerned.
MWSharedText MWInternPath(std::string_view path, uint64_t baseAddress);
/// From the program's table of segment names, of which there are few.
MWSharedText MWInternSegmentName(std::string_view name);

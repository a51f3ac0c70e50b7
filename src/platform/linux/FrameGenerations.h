#pragma once

#include <array>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <span>
#include <vector>

/// Memory that a fork family shares is cut at multiples of this, so that a process which was forked before
/// an allocation is not taken for one of its sharers.
inline constexpr uint64_t MWFamilyWindow = 4ULL << 20U;

/// Which page frames of one fork family at one address are the same memory.
///
/// A child that rewrites memory and forks again shares new frames with its own children, at the addresses at
/// which its parent shares the old ones with everybody else:
///
///     address      parent, child 1   child 2, its children
///     slot 0       frame A           frame C                 generation 0: A    generation 1: C
///     slot 1       frame B           frame B                 generation 0: B    generation 1: -
///
/// For each window there is a table for each generation: the frame first seen at each of its pages. A page
/// belongs to the first generation whose slot holds its frame or is still empty. Each distinct frame thus
/// gets one (slot, generation), whichever process is read first. Where frames are hidden there is one
/// generation. Safe for use from several threads.
class FrameGenerations {
public:
    struct Page {
        uint32_t slot = 0;   ///< page within the window, below MWFamilyWindow / page size
        uint64_t frame = 0;  ///< frame number or swap entry; 0 where the kernel hides it
    };

    /// The generation of each page; all of them lie in the window at `window`, an address.
    void assign(uint64_t window, std::span<const Page> pages, std::span<uint32_t> generations);

    /// The pages that have been told apart so far.
    uint64_t pages() const;

private:
    static constexpr size_t kSlots = MWFamilyWindow / 4096;

    using Generation = std::array<uint32_t, kSlots>;
    using Window = std::vector<std::unique_ptr<Generation>>;

    uint32_t _assign(Window& window, const Page& page);

    mutable std::mutex _mutex;
    uint64_t _pages = 0;
    std::map<uint64_t, Window> _windows;
};

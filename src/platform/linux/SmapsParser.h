#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

namespace procfs {

/// What the VmFlags line of smaps says, as far as it is used.
enum VmFlag : uint32_t {
    VmFlagMayRead = 1U << 0U,       // mr
    VmFlagMayWrite = 1U << 1U,      // mw
    VmFlagMayExecute = 1U << 2U,    // me
    VmFlagLocked = 1U << 3U,        // lo
    VmFlagHugetlb = 1U << 4U,       // ht
    VmFlagAccountable = 1U << 5U,   // ac: charged to the commit limit, so it was writable once
    VmFlagNoHugepage = 1U << 6U,    // nh: MAP_STACK shows so since 6.7
    VmFlagIo = 1U << 7U,            // io
    VmFlagPfnMap = 1U << 8U,        // pf
    VmFlagGrowsDown = 1U << 9U,     // gd
    VmFlagNoReserve = 1U << 10U,    // nr: mapped with MAP_NORESERVE
    VmFlagShadowStack = 1U << 11U,  // ss, since 6.6
};

/// One mapping, as a line of `maps` and the lines that `smaps` adds to it tell. Sizes are bytes.
struct Vma {
    uint64_t start = 0;
    uint64_t end = 0;
    uint64_t offset = 0;
    uint64_t inode = 0;
    uint32_t deviceMajor = 0;
    uint32_t deviceMinor = 0;
    bool readable = false;
    bool writable = false;
    bool executable = false;
    bool shared = false;
    bool deleted = false;    ///< the path ended in " (deleted)", which is taken off
    bool hasCounts = false;  ///< at least one size line was seen
    std::string path;        ///< with escapes undone; a special name such as "[heap]"; empty for none
    uint32_t flags = 0;      ///< VmFlag bits

    uint64_t rss = 0;  ///< without hugetlb pages
    uint64_t pss = 0;
    uint64_t sharedClean = 0;
    uint64_t sharedDirty = 0;
    uint64_t privateDirty = 0;
    uint64_t anonymous = 0;
    uint64_t ksm = 0;  ///< merged with equal pages of any process
    uint64_t lazyFree = 0;
    uint64_t sharedHugetlb = 0;
    uint64_t privateHugetlb = 0;
    uint64_t swap = 0;  ///< swapped shmem pages included
    uint64_t swapPss = 0;

    uint64_t size() const { return end - start; }
    uint64_t resident() const { return rss + sharedHugetlb + privateHugetlb; }
    uint64_t device() const { return (uint64_t{deviceMajor} << 32U) | deviceMinor; }
    bool has(VmFlag flag) const { return (flags & flag) != 0; }
    bool operator==(const Vma&) const = default;
};

/// Turns the text of `smaps` or `maps` into mappings, piece by piece: the text of a process with 40,000
/// mappings is 28 MB and is never held whole. Lines that cannot be read as what they should be are passed
/// over, unknown fields are ignored, fields that an older kernel lacks stay 0, so any text at all gives a
/// list of mappings whose end is above their start, in ascending order and without overlap, none of them with
/// a count above its size.
class SmapsParser {
public:
    /// Uses the room of `vmas`, whatever they were.
    explicit SmapsParser(std::vector<Vma> vmas = {}) : _vmas(std::move(vmas)) { _vmas.clear(); }

    void feed(std::string_view text);
    /// The mappings of all the text fed; the parser is then empty again.
    std::vector<Vma> finish();

private:
    void _parseLine(std::string_view line);
    void _parseHeader(std::string_view line);
    void _makeRoomForMany();
    void _parseField(std::string_view line);

    std::vector<Vma> _vmas;
    std::string _carried;     ///< the beginning of a line whose end has not been fed yet
    bool _inMapping = false;  ///< field lines belong to the last mapping
    size_t _nextField = 0;    ///< the kernel writes fields in one order: look there first
};

/// The mappings of a process, from its `smaps` or `maps`; false with errno when not all of it could be read.
bool readMappings(int processDirectory, const char* file, std::vector<Vma>& vmas);

/// All the mappings of a text.
std::vector<Vma> parseSmaps(std::string_view text);

}  // namespace procfs

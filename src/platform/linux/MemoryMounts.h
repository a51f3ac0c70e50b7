#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>

enum class MemoryFileSystem : uint8_t { none, shmem, hugetlb };

/// Where a mount namespace has file systems that live in memory. Tells it by paths and device numbers and
/// never asks about a file: a look at one on a dead network server could take for ever.
class MemoryMounts {
public:
    /// `mountinfo` is the text of a process that sees the namespace; `root` is where that process has its
    /// root, as the paths that are asked about have it.
    explicit MemoryMounts(std::string_view mountinfo, std::string_view root = "/");

    /// Whether the innermost mount above `path` is a memory file system.
    bool hold(std::string_view path) const;
    /// The file system with this device number (major << 32 | minor): the path of a file on another one,
    /// whose mount point has been taken away, can read as if it lay in memory.
    MemoryFileSystem ofDevice(uint64_t device) const;

private:
    std::unordered_map<std::string, MemoryFileSystem> _points;  ///< without the slash at the end
    std::unordered_map<uint64_t, MemoryFileSystem> _devices;
};

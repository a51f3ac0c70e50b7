#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

/// Where a mount namespace has file systems that live in memory. Tells which file system a path lies on
/// without touching it: a look at a file on a dead network server could take for ever.
class MemoryMounts {
public:
    /// `mountinfo` is the text of a process that sees the namespace.
    explicit MemoryMounts(std::string_view mountinfo);

    /// Whether the innermost mount above `path` is a memory file system.
    bool hold(std::string_view path) const;

private:
    struct Mount {
        std::string point;  ///< without the slash at the end
        bool inMemory;
    };
    std::vector<Mount> _mounts;  ///< innermost first; of two on one point, the upper one alone
};

#pragma once

#include <cstdint>
#include <mutex>
#include <string_view>
#include <unordered_map>
#include <vector>

namespace procfs {

struct Mount {
    uint64_t device = 0;  ///< major << 32 | minor
    std::string_view fileSystem;
};

/// The mounts of a `mountinfo` text, whose storage they point into; lines that are cut are passed over.
std::vector<Mount> parseMountinfo(std::string_view text);

}  // namespace procfs

/// Which device numbers are memory file systems, whose pages only swap can take: the kernel's internal mount
/// (memfd, SysV, shared anonymous memory), and whatever tmpfs the processes have mounted. Safe for use from
/// several threads.
class ShmemDevices {
public:
    ShmemDevices();

    /// `processDirectory` is where an unknown device is looked up (`mountinfo`); a device that is mounted
    /// nowhere there counts as a disk.
    bool isShmem(uint64_t device, int processDirectory);

private:
    std::mutex _mutex;
    std::unordered_map<uint64_t, bool> _isShmem;
};

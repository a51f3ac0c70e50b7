#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <set>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

namespace procfs {

struct Mount {
    uint64_t device = 0;     ///< major << 32 | minor
    std::string_view point;  ///< as written, with octal escapes
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

    /// The kernel's internal mount, on which SysV segments lie; 0 when it is not known.
    uint64_t internalDevice() const { return _internalDevice; }
    /// Whether it is one of the kernel's internal mounts for huge pages, of which each size has one.
    bool isInternalHugetlb(uint64_t device) const { return _internalHugetlb.contains(device); }
    /// `processDirectory` is where an unknown device is looked up (`mountinfo`). A device that is mounted
    /// nowhere there (the layers of an overlay, for one) counts as a disk, for the processes of that mount
    /// namespace only: what one process cannot see another may have mounted.
    bool isShmem(uint64_t device, int processDirectory);

private:
    std::optional<bool> _known(uint64_t device, uint64_t mountNamespace);

    uint64_t _internalDevice = 0;
    std::set<uint64_t> _internalHugetlb;
    std::mutex _mutex;
    std::unordered_map<uint64_t, bool> _isShmem;
    std::set<std::pair<uint64_t, uint64_t>> _notMounted;  ///< mount namespace and device
};

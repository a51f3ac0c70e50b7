#pragma once

#include <array>
#include <cstdint>
#include <initializer_list>
#include <string_view>

/// Numbers for what backs a mapping, equal exactly where two mappings show the same memory. A 64-bit keyed
/// hash with bit 63 set, so that it is never 0 (never counted) nor one of the small numbers that the kernel
/// pseudo-process gives its own objects; never all ones. The key is the boot id: figures of two machines, or
/// from before and after a reboot, never join by accident.
class ObjectIdentity {
public:
    explicit ObjectIdentity(std::string_view bootId);

    /// A file, shmem object or hugetlb file.
    uint64_t file(uint64_t device, uint64_t inode) const;
    /// A SysV segment: its inode is the segment's id, which can be 0, and which other IPC namespaces and
    /// memfds on the same device use as well.
    uint64_t sysV(uint64_t device, uint64_t inode, uint64_t ipcNamespace) const;
    /// Memory that only this process maps.
    uint64_t process(int32_t pid, uint64_t startTime, uint64_t address) const;
    /// Memory shared copy-on-write by the processes of a fork family, in one window of their addresses.
    struct FamilyMemory {
        uint64_t family;
        uint64_t window;
        uint64_t file;  ///< whose data it is, by the file's identity; 0 for memory of no file
        uint32_t tag;
        uint32_t generation;
    };
    uint64_t family(const FamilyMemory& memory) const;
    /// What no mapping shows; `first` and `second` name the object among those of its kind.
    enum class Unmapped : uint64_t { socket = 5, socketsOfProcess, bpfMap, drmClient };
    uint64_t unmapped(Unmapped kind, uint64_t first, uint64_t second) const;
    /// Any bytes; cannot be undone.
    uint64_t bytes(std::string_view bytes) const;

private:
    uint64_t _hash(std::initializer_list<uint64_t> what) const;

    std::array<unsigned char, 16> _key = {};
};

#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>

#include "platform/MWHostRecords.h"
#include "platform/linux/MemoryMounts.h"
#include "platform/linux/ObjectIdentity.h"
#include "platform/linux/ShmemDevices.h"
#include "platform/linux/SocketMemory.h"

/// A kernel object that a process holds through a descriptor. A socket's record has its bytes alone: sockets
/// are reported in one sum.
struct HeldObject {
    OwnedObjectRecord record = {};
    // Of a file, which others can map; 0 for everything else.
    uint64_t device = 0;  ///< major << 32 | minor
    uint64_t inode = 0;

    bool isSocket() const { return record.ledgerTag() == MWLedgerNetwork; }
    bool canBeMapped() const { return inode != 0; }
};

/// By `object_id`.
using HeldObjects = std::unordered_map<uint64_t, HeldObject>;

/// What the descriptors of many processes lead to alike, looked up when the first of them does. Safe for use
/// from several threads.
class DescriptorTargets {
public:
    explicit DescriptorTargets(const ShmemDevices& devices) : _devices(devices) {}

    /// Of the mount namespace of the process with this directory, by the paths that its links have.
    std::shared_ptr<const MemoryMounts> mountsOf(int processDirectory);
    /// Whether the path has been seen to lead to something else than a file: every process has its terminal
    /// or /dev/null open several times.
    bool isOtherNode(const std::shared_ptr<const MemoryMounts>& mounts, const std::string& path) const;
    void addOtherNode(const std::shared_ptr<const MemoryMounts>& mounts, const std::string& path);
    struct Socket {
        uint64_t inode;
        uint64_t networkNamespace;  ///< in which the process is
        int processDirectory;
        int directory;           ///< the process's "fd"
        const char* descriptor;  ///< the socket's entry there
    };
    /// What the socket holds in the kernel.
    uint64_t bytesOf(const Socket& socket);
    /// The memory file system with this device number, mounted in `mounts` or internal to the kernel.
    MemoryFileSystem fileSystemOf(uint64_t device, const MemoryMounts& mounts) const;

private:
    /// None where the namespace cannot be entered through this process; through another one it may be.
    SocketMemory* _socketsOf(uint64_t networkNamespace, int processDirectory);

    const ShmemDevices& _devices;
    mutable std::mutex _mutex;
    std::map<std::pair<uint64_t, std::string>, std::shared_ptr<const MemoryMounts>> _mounts;
    std::set<std::pair<std::shared_ptr<const MemoryMounts>, std::string>> _otherNodes;
    std::map<uint64_t, std::unique_ptr<SocketMemory>> _sockets;  ///< by network namespace
    bool _triedOwnNamespace = false;                             ///< the tool's
};

struct DescriptorScan {
    DescriptorTargets& targets;
    const ObjectIdentity& identity;
    uint64_t pageSize;
};

/// Everything that holds memory behind the descriptors of a process, as far as the caller may look. Costs one
/// readlink for each descriptor; a file is looked at only where it lies in memory, so that no dead server can
/// hold the scan up, and nothing that can be told from outside happens to any of them.
HeldObjects heldObjects(int processDirectory, const DescriptorScan& scan);

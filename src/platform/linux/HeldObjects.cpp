#include "platform/linux/HeldObjects.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysinfo.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <optional>
#include <utility>

#include "platform/linux/Cachestat.h"
#include "platform/linux/Fdinfo.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace {

bool isSwapInUse() {
    struct sysinfo system = {};
    return sysinfo(&system) == 0 && system.freeswap != system.totalswap;
}

// Of the pages of a memory file, the bytes that are in swap. Asked only where there is something in swap at
// all, as the file has to be opened for it.
uint64_t swappedBytes(int directory, const char* path, uint64_t pageSize) {
    if (!isSwapInUse()) {
        return 0;
    }
    const procfs::Descriptor file = procfs::open(directory, path, O_NONBLOCK | O_NOCTTY);
    const std::optional<Cachestat> pages = file ? readCachestat(file.get()) : std::nullopt;
    return pages ? pages->evicted * pageSize : 0;
}

std::optional<uint64_t> numberInBrackets(std::string_view text) {
    uint64_t number = 0;
    const bool read = procfs::takeNumber(text, number) && text == "]";
    return read ? std::optional(number) : std::nullopt;
}

/// The look at one process.
class Descriptors {
public:
    Descriptors(int processDirectory, const DescriptorScan& scan) : _process(processDirectory), _scan(scan) {}

    HeldObjects scan() {
        procfs::forEachEntry(_process, "fd", [this](int directory, const char* number) {
            if (procfs::readLink(directory, number, _target)) {
                _look(directory, number);
            }
            return true;
        });
        std::erase_if(_objects, [](const auto& entry) {
            return entry.second.record.resident + entry.second.record.compressed == 0;
        });
        return std::move(_objects);
    }

private:
    void _look(int directory, const char* number) {
        const std::string_view target = _target;
        std::string_view socket = target;
        if (procfs::takePrefix(socket, "socket:[")) {
            _addSocket(numberInBrackets(socket).value_or(0), directory, number);
        } else if (target == "anon_inode:bpf-map") {
            _addBpfMap(number);
        } else if (target.starts_with("/dev/dri/")) {
            _addDrmClient(number, MWLedgerGraphics);
        } else if (target.starts_with("/dev/accel/")) {
            _addDrmClient(number, MWLedgerNeural);
        } else if (target.starts_with("/dmabuf:")) {
            _addDmaBuffer(directory, number);
        } else if (target.starts_with("/memfd:") || (target.starts_with('/') && _mounts().hold(target) &&
                                                     !_scan.targets.isOtherNode(_knownMounts, _target))) {
            _addFile(directory, number);
        }
    }

    void _addSocket(uint64_t inode, int directory, const char* number) {
        if (!_networkNamespace) {
            _networkNamespace = procfs::readNamespace(_process, "net");
        }
        const uint64_t bytes = _scan.targets.bytesOf({.inode = inode,
                                                      .networkNamespace = *_networkNamespace,
                                                      .processDirectory = _process,
                                                      .directory = directory,
                                                      .descriptor = number});
        if (bytes != 0) {
            // Sockets of all namespaces are numbered in one row.
            _add(_scan.identity.unmapped(ObjectIdentity::Unmapped::socket, inode, 0), MWLedgerNetwork,
                 {.virtual_size = bytes, .resident = bytes});
        }
    }

    void _addBpfMap(const char* number) {
        if (const auto map = procfs::parseBpfMap(_fdinfo(number))) {
            _add(_scan.identity.unmapped(ObjectIdentity::Unmapped::bpfMap, map->identifier, 0),
                 MWLedgerDefault, {.virtual_size = map->memory, .resident = map->memory});
        }
    }

    void _addDrmClient(const char* number, MWLedgerTag tag) {
        if (const auto client = procfs::parseDrmClient(_fdinfo(number))) {
            const uint64_t device = _scan.identity.bytes(client->device);
            _add(
                _scan.identity.unmapped(ObjectIdentity::Unmapped::drmClient, device, client->identifier), tag,
                {.virtual_size = client->total, .resident = client->resident, .reusable = client->purgeable});
        }
    }

    void _addDmaBuffer(int directory, const char* number) {
        const auto buffer = procfs::parseDmaBuffer(_fdinfo(number));
        const auto file = buffer ? _status(directory, number) : std::nullopt;
        if (file) {
            _add(_scan.identity.file(_deviceOf(*file), file->stx_ino),
                 buffer->fromVideoDevice ? MWLedgerMedia : MWLedgerGraphics,
                 {.virtual_size = buffer->size, .resident = buffer->size});
        }
    }

    void _addFile(int directory, const char* number) {
        const auto file = _status(directory, number);
        constexpr uint64_t kBlock = 512;
        if (file && !S_ISREG(file->stx_mode)) {
            _scan.targets.addOtherNode(_knownMounts, _target);
        }
        if (!file || !S_ISREG(file->stx_mode) || file->stx_blocks == 0) {
            return;
        }
        const uint64_t bytes = file->stx_blocks * kBlock;
        OwnedObjectRecord record = {.virtual_size = std::max<uint64_t>(file->stx_size, bytes),
                                    .resident = bytes};
        const uint64_t device = _deviceOf(*file);
        switch (_scan.targets.fileSystemOf(device, _mounts())) {
            case MemoryFileSystem::shmem:
                record.compressed = std::min(bytes, swappedBytes(directory, number, _scan.pageSize));
                record.resident -= record.compressed;
                break;
            case MemoryFileSystem::hugetlb:
                record.wired = bytes;
                break;
            case MemoryFileSystem::none:
                return;
        }
        HeldObject& object = _add(_scan.identity.file(device, file->stx_ino), MWLedgerDefault, record);
        object.device = device;
        object.inode = file->stx_ino;
    }

    static uint64_t _deviceOf(const struct statx& file) {
        return (uint64_t{file.stx_dev_major} << 32U) | file.stx_dev_minor;
    }

    static std::optional<struct statx> _status(int directory, const char* number) {
        struct statx file = {};
        const bool known = statx(directory, number, AT_STATX_DONT_SYNC, STATX_BASIC_STATS, &file) == 0;
        return known ? std::optional(file) : std::nullopt;
    }

    HeldObject& _add(uint64_t identifier, MWLedgerTag tag, OwnedObjectRecord record) {
        record.object_id = identifier;
        record.flags = OwnedObjectRecord::flagsFor(tag, VM_PURGABLE_DENY);
        return _objects.insert_or_assign(identifier, HeldObject{.record = record}).first->second;
    }

    const std::string& _fdinfo(const char* number) {
        procfs::readFile(_process, (std::string("fdinfo/") + number).c_str(), _text);
        return _text;
    }

    const MemoryMounts& _mounts() {
        if (_knownMounts == nullptr) {
            _knownMounts = _scan.targets.mountsOf(_process);
        }
        return *_knownMounts;
    }

    int _process;
    const DescriptorScan& _scan;
    HeldObjects _objects;
    std::string _target;
    std::string _text;
    std::shared_ptr<const MemoryMounts> _knownMounts;
    std::optional<uint64_t> _networkNamespace;
};

}  // namespace

// What a process that is about to end tells, or does not, is no answer for the others of its namespace.
std::shared_ptr<const MemoryMounts> DescriptorTargets::mountsOf(int processDirectory) {
    constexpr size_t kLongestMountinfo = 64U << 20U;
    std::string root;
    procfs::readLink(processDirectory, "root", root);
    const std::pair key(procfs::readNamespace(processDirectory, "mnt"), root);
    {
        const std::lock_guard lock(_mutex);
        if (const auto known = _mounts.find(key); known != _mounts.end()) {
            return known->second;
        }
    }
    std::string text;
    const bool isWhole = procfs::readFile(processDirectory, "mountinfo", text, kLongestMountinfo);
    auto mounts = std::make_shared<const MemoryMounts>(text, root);
    if (isWhole && !text.empty() && key.first != 0) {
        const std::lock_guard lock(_mutex);
        _mounts.emplace(key, mounts);
    }
    return mounts;
}

bool DescriptorTargets::isOtherNode(const std::shared_ptr<const MemoryMounts>& mounts,
                                    const std::string& path) const {
    const std::lock_guard lock(_mutex);
    return _otherNodes.contains({mounts, path});
}

// The path of a node that has been removed says so, and can belong to several.
void DescriptorTargets::addOtherNode(const std::shared_ptr<const MemoryMounts>& mounts,
                                     const std::string& path) {
    if (mounts != nullptr && !path.ends_with(" (deleted)")) {
        const std::lock_guard lock(_mutex);
        _otherNodes.emplace(mounts, path);
    }
}

SocketMemory* DescriptorTargets::_socketsOf(uint64_t networkNamespace, int processDirectory) {
    auto& sockets = _sockets[networkNamespace];
    if (sockets == nullptr) {
        sockets = SocketMemory::ofNamespace(networkNamespace, processDirectory);
    }
    return sockets.get();
}

// A socket stays in the namespace in which it was made, whichever one its process goes to.
uint64_t DescriptorTargets::bytesOf(const Socket& socket) {
    const std::lock_guard lock(_mutex);
    SocketMemory* own = _socketsOf(socket.networkNamespace, socket.processDirectory);
    if (own != nullptr) {
        if (const auto bytes = own->bytesOf(socket.inode, socket.directory, socket.descriptor)) {
            return *bytes;
        }
    }
    if (!std::exchange(_triedOwnNamespace, true)) {
        const procfs::Descriptor self = procfs::open(AT_FDCWD, "/proc/thread-self", O_PATH);
        _socketsOf(procfs::readNamespace(self.get(), "net"), self.get());
    }
    for (const auto& [number, other] : _sockets) {
        if (other != nullptr && other.get() != own) {
            if (const auto bytes = other->bytesOf(socket.inode, socket.directory, socket.descriptor)) {
                return *bytes;
            }
        }
    }
    return 0;
}

MemoryFileSystem DescriptorTargets::fileSystemOf(uint64_t device, const MemoryMounts& mounts) const {
    if (device == _devices.internalDevice()) {
        return MemoryFileSystem::shmem;
    }
    return _devices.isInternalHugetlb(device) ? MemoryFileSystem::hugetlb : mounts.ofDevice(device);
}

HeldObjects heldObjects(int processDirectory, const DescriptorScan& scan) {
    return Descriptors(processDirectory, scan).scan();
}

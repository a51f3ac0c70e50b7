#include "platform/linux/ShmemDevices.h"

#include <linux/memfd.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>

#include <string>

#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace procfs {

// "ID PARENT MAJOR:MINOR ROOT MOUNTPOINT OPTIONS [TAG...] - TYPE SOURCE SUPEROPTIONS"
std::vector<Mount> parseMountinfo(std::string_view text) {
    std::vector<Mount> mounts;
    while (!text.empty()) {
        std::string_view line = takeLine(text);
        const size_t separator = line.find(" - ");
        uint64_t id = 0;
        uint64_t major = 0;
        uint64_t minor = 0;
        if (separator == std::string_view::npos) {
            continue;
        }
        std::string_view type = line.substr(separator + 3);
        type = type.substr(0, type.find(' '));
        if (takeNumber(line, id) && takePrefix(line, " ") && takeNumber(line, id) && takePrefix(line, " ") &&
            takeNumber(line, major) && takePrefix(line, ":") && takeNumber(line, minor) &&
            takePrefix(line, " ")) {
            line.remove_prefix(std::min(line.find(' '), line.size()));  // the root within the file system
            takePrefix(line, " ");
            mounts.push_back({(major << 32U) | minor, line.substr(0, line.find(' ')), type});
        }
    }
    return mounts;
}

}  // namespace procfs

namespace {

// Of a file that is made for the question; none where the kernel makes none of this kind.
std::optional<uint64_t> deviceOfMemfd(unsigned flags) {
    const procfs::Descriptor probe(memfd_create("memweight-probe", MFD_CLOEXEC | flags));
    struct stat status = {};
    if (!probe || fstat(probe.get(), &status) != 0) {
        return std::nullopt;
    }
    return (uint64_t{major(status.st_dev)} << 32U) | minor(status.st_dev);
}

}  // namespace

// The internal mounts have no entry anywhere, but every memfd lies on one.
ShmemDevices::ShmemDevices() {
    if (const auto device = deviceOfMemfd(0)) {
        _internalDevice = *device;
        _isShmem[_internalDevice] = true;
    }
    constexpr unsigned kSmallestHugePage = 16;  // 64 KiB, as a power of 2
    constexpr unsigned kLargestHugePage = 34;
    for (unsigned size = kSmallestHugePage; size <= kLargestHugePage; ++size) {
        if (const auto device = deviceOfMemfd(MFD_HUGETLB | (size << MFD_HUGE_SHIFT))) {
            _internalHugetlb.insert(*device);
        }
    }
}

std::optional<bool> ShmemDevices::_known(uint64_t device, uint64_t mountNamespace) {
    const std::lock_guard lock(_mutex);
    if (const auto known = _isShmem.find(device); known != _isShmem.end()) {
        return known->second;
    }
    return _notMounted.contains({mountNamespace, device}) ? std::optional(false) : std::nullopt;
}

bool ShmemDevices::isShmem(uint64_t device, int processDirectory) {
    constexpr size_t kLongestMountinfo = 64U << 20U;
    if (const auto known = _known(device, 0)) {
        return *known;
    }
    const uint64_t mountNamespace = procfs::readNamespace(processDirectory, "mnt");
    if (const auto known = _known(device, mountNamespace)) {
        return *known;
    }
    std::string text;
    const bool read =
        procfs::readFile(processDirectory, "mountinfo", text, kLongestMountinfo) && !text.empty();
    const std::lock_guard lock(_mutex);
    for (const procfs::Mount& mount : procfs::parseMountinfo(text)) {
        _isShmem.emplace(mount.device, mount.fileSystem == "tmpfs" || mount.fileSystem == "devtmpfs" ||
                                           mount.fileSystem == "ramfs");
    }
    if (const auto found = _isShmem.find(device); found != _isShmem.end()) {
        return found->second;
    }
    if (read && mountNamespace != 0) {
        _notMounted.emplace(mountNamespace, device);
    }
    return false;
}

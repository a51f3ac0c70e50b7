#include "platform/linux/ShmemDevices.h"

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
            takeNumber(line, major) && takePrefix(line, ":") && takeNumber(line, minor)) {
            mounts.push_back({(major << 32U) | minor, type});
        }
    }
    return mounts;
}

}  // namespace procfs

// The internal mount has no entry anywhere, but every memfd lies on it.
ShmemDevices::ShmemDevices() {
    const procfs::Descriptor probe(memfd_create("memweight-probe", MFD_CLOEXEC));
    struct stat status = {};
    if (probe && fstat(probe.get(), &status) == 0) {
        _isShmem[(uint64_t{major(status.st_dev)} << 32U) | minor(status.st_dev)] = true;
    }
}

bool ShmemDevices::isShmem(uint64_t device, int processDirectory) {
    const std::lock_guard lock(_mutex);
    const auto known = _isShmem.find(device);
    if (known != _isShmem.end()) {
        return known->second;
    }
    std::string text;
    procfs::readFile(processDirectory, "mountinfo", text);
    for (const procfs::Mount& mount : procfs::parseMountinfo(text)) {
        _isShmem.emplace(mount.device, mount.fileSystem == "tmpfs" || mount.fileSystem == "ramfs");
    }
    return _isShmem.emplace(device, false).first->second;
}

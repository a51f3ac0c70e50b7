#include "platform/linux/MemoryMounts.h"

#include "platform/linux/ShmemDevices.h"

namespace {

MemoryFileSystem kindOf(std::string_view fileSystem) {
    if (fileSystem == "hugetlbfs") {
        return MemoryFileSystem::hugetlb;
    }
    const bool isShmem = fileSystem == "tmpfs" || fileSystem == "devtmpfs" || fileSystem == "rootfs";
    return isShmem ? MemoryFileSystem::shmem : MemoryFileSystem::none;
}

bool isDigit(char character, char last) {
    return character >= '0' && character <= last;
}

// Blanks, line ends and backslashes stand as "\040", three octal digits.
std::string unescaped(std::string_view text) {
    std::string plain;
    for (size_t at = 0; at < text.size(); ++at) {
        const std::string_view digits = text.substr(at + 1, 3);
        if (text[at] == '\\' && digits.size() == 3 && isDigit(digits[0], '3') && isDigit(digits[1], '7') &&
            isDigit(digits[2], '7')) {
            plain += static_cast<char>((digits[0] - '0') * 64 + (digits[1] - '0') * 8 + (digits[2] - '0'));
            at += digits.size();
        } else {
            plain += text[at];
        }
    }
    return plain;
}

std::string_view withoutLastSlash(std::string_view path) {
    return path.substr(0, path.size() - (path.ends_with('/') ? 1 : 0));
}

}  // namespace

// Of two mounts on one point the later one lies above.
MemoryMounts::MemoryMounts(std::string_view mountinfo, std::string_view root) {
    for (const procfs::Mount& mount : procfs::parseMountinfo(mountinfo)) {
        const MemoryFileSystem kind = kindOf(mount.fileSystem);
        const std::string point = std::string(withoutLastSlash(root)) + unescaped(mount.point);
        _points.insert_or_assign(std::string(withoutLastSlash(point)), kind);
        _devices.emplace(mount.device, kind);
    }
}

bool MemoryMounts::hold(std::string_view path) const {
    for (size_t end = path.size(); end != std::string_view::npos; end = path.rfind('/', end - 1)) {
        if (const auto found = _points.find(std::string(path.substr(0, end))); found != _points.end()) {
            return found->second != MemoryFileSystem::none;
        }
        if (end == 0) {
            break;
        }
    }
    return false;
}

MemoryFileSystem MemoryMounts::ofDevice(uint64_t device) const {
    const auto found = _devices.find(device);
    return found == _devices.end() ? MemoryFileSystem::none : found->second;
}

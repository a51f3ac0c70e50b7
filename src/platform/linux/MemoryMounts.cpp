#include "platform/linux/MemoryMounts.h"

#include <algorithm>

#include "platform/linux/ShmemDevices.h"

namespace {

bool livesInMemory(std::string_view fileSystem) {
    return fileSystem == "tmpfs" || fileSystem == "hugetlbfs";
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

bool liesBelow(std::string_view path, std::string_view point) {
    return path.starts_with(point) && (path.size() == point.size() || path[point.size()] == '/');
}

}  // namespace

MemoryMounts::MemoryMounts(std::string_view mountinfo) {
    for (const procfs::Mount& mount : procfs::parseMountinfo(mountinfo)) {
        std::string point = unescaped(mount.point);
        if (point.ends_with('/')) {
            point.pop_back();
        }
        std::erase_if(_mounts, [&](const Mount& earlier) { return earlier.point == point; });
        _mounts.push_back({std::move(point), livesInMemory(mount.fileSystem)});
    }
    std::ranges::stable_sort(_mounts, std::ranges::greater(),
                             [](const Mount& mount) { return mount.point.size(); });
}

bool MemoryMounts::hold(std::string_view path) const {
    const auto innermost =
        std::ranges::find_if(_mounts, [=](const Mount& mount) { return liesBelow(path, mount.point); });
    return innermost != _mounts.end() && innermost->inMemory;
}

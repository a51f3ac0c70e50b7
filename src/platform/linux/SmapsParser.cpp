#include "platform/linux/SmapsParser.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <memory>
#include <utility>

#include "platform/MWHeap.h"
#include "platform/linux/ProcText.h"
#include "platform/linux/Procfs.h"

namespace procfs {

namespace {

struct Field {
    std::string_view name;
    uint64_t Vma::*bytes;
};

// In the order in which the kernel writes them.
constexpr std::array<Field, 12> kFields = {{{"Rss", &Vma::rss},
                                            {"Pss", &Vma::pss},
                                            {"Shared_Clean", &Vma::sharedClean},
                                            {"Shared_Dirty", &Vma::sharedDirty},
                                            {"Private_Dirty", &Vma::privateDirty},
                                            {"Anonymous", &Vma::anonymous},
                                            {"KSM", &Vma::ksm},
                                            {"LazyFree", &Vma::lazyFree},
                                            {"Shared_Hugetlb", &Vma::sharedHugetlb},
                                            {"Private_Hugetlb", &Vma::privateHugetlb},
                                            {"Swap", &Vma::swap},
                                            {"SwapPss", &Vma::swapPss}}};

constexpr std::array<std::pair<std::string_view, VmFlag>, 12> kFlags = {{{"mr", VmFlagMayRead},
                                                                         {"mw", VmFlagMayWrite},
                                                                         {"me", VmFlagMayExecute},
                                                                         {"lo", VmFlagLocked},
                                                                         {"ht", VmFlagHugetlb},
                                                                         {"ac", VmFlagAccountable},
                                                                         {"nh", VmFlagNoHugepage},
                                                                         {"io", VmFlagIo},
                                                                         {"pf", VmFlagPfnMap},
                                                                         {"gd", VmFlagGrowsDown},
                                                                         {"nr", VmFlagNoReserve},
                                                                         {"ss", VmFlagShadowStack}}};

// A line of a mapping holds one path, of at most 4096 bytes of which each can be written as four. What goes
// on behind that is passed over.
constexpr size_t kLongestLine = size_t{5} * 4096;

uint32_t parseFlags(std::string_view text) {
    uint32_t flags = 0;
    for (skipBlanks(text); text.size() >= 2; skipBlanks(text)) {
        for (const auto& [name, flag] : kFlags) {
            if (text.starts_with(name)) {
                flags |= flag;
                break;
            }
        }
        text.remove_prefix(2);
    }
    return flags;
}

bool takePermissions(std::string_view& text, Vma& vma) {
    if (text.size() < 4) {
        return false;
    }
    vma.readable = text[0] == 'r';
    vma.writable = text[1] == 'w';
    vma.executable = text[2] == 'x';
    vma.shared = text[3] == 's';
    text.remove_prefix(4);
    return true;
}

// A line feed is the only character that the kernel escapes in a path.
std::string unescaped(std::string_view path) {
    constexpr std::string_view kEscape = "\\012";
    std::string plain;
    for (size_t at = path.find(kEscape); at != std::string_view::npos; at = path.find(kEscape)) {
        plain += path.substr(0, at);
        plain += '\n';
        path.remove_prefix(at + kEscape.size());
    }
    return plain.append(path);
}

void setPath(Vma& vma, std::string_view path) {
    constexpr std::string_view kDeleted = " (deleted)";
    if (path.ends_with(kDeleted)) {
        vma.deleted = true;
        path.remove_suffix(kDeleted.size());
    }
    vma.path = unescaped(path);
}

// "START-END rwxp OFFSET MAJOR:MINOR INODE      PATH"
bool parseMapping(std::string_view line, Vma& vma) {
    constexpr int kHex = 16;
    const bool read =
        takeNumber(line, vma.start, kHex) && takePrefix(line, "-") && takeNumber(line, vma.end, kHex) &&
        takePrefix(line, " ") && takePermissions(line, vma) && takePrefix(line, " ") &&
        takeNumber(line, vma.offset, kHex) && takePrefix(line, " ") &&
        takeNumber(line, vma.deviceMajor, kHex) && takePrefix(line, ":") &&
        takeNumber(line, vma.deviceMinor, kHex) && takePrefix(line, " ") && takeNumber(line, vma.inode);
    if (!read || vma.end <= vma.start) {
        return false;
    }
    skipBlanks(line);
    setPath(vma, line);
    return true;
}

bool isMapping(std::string_view line) {
    const char first = line.empty() ? '\0' : line.front();
    return (first >= '0' && first <= '9') || (first >= 'a' && first <= 'f');
}

}  // namespace

void SmapsParser::feed(std::string_view text) {
    for (size_t end = text.find('\n'); end != std::string_view::npos; end = text.find('\n')) {
        if (_carried.empty()) {
            _parseLine(text.substr(0, end));
        } else {
            _carried += text.substr(0, end);
            _parseLine(std::exchange(_carried, {}));
        }
        text.remove_prefix(end + 1);
    }
    if (_carried.size() < kLongestLine) {
        _carried += text.substr(0, kLongestLine);
    }
}

std::vector<Vma> SmapsParser::finish() {
    if (!_carried.empty()) {
        _parseLine(std::exchange(_carried, {}));
    }
    _inMapping = false;
    return std::exchange(_vmas, {});
}

void SmapsParser::_parseLine(std::string_view line) {
    line = line.substr(0, kLongestLine);
    if (isMapping(line)) {
        _parseHeader(line);
    } else if (_inMapping) {
        _parseField(line);
    }
}

// Room that is not touched costs nothing, other than to move everything into a larger one again and again. It
// is made at once for as many as the kernel allows a process unless told otherwise.
void SmapsParser::_makeRoomForMany() {
    constexpr size_t kMany = 4096;
    constexpr size_t kUsualLimit = 65536;
    if (_vmas.size() == kMany) {
        _vmas.reserve(kUsualLimit);
        MWUseLargePages(_vmas.data(), kUsualLimit * sizeof(Vma));
    }
}

// Sizes of a mapping that could not be read must not land on the one before it.
void SmapsParser::_parseHeader(std::string_view line) {
    _makeRoomForMany();
    const uint64_t lowest = _vmas.empty() ? 0 : _vmas.back().end;
    Vma& vma = _vmas.emplace_back();
    _inMapping = parseMapping(line, vma) && vma.start >= lowest;
    if (!_inMapping) {
        _vmas.pop_back();
    }
}

void SmapsParser::_parseField(std::string_view line) {
    if (takePrefix(line, "VmFlags:")) {
        _vmas.back().flags = parseFlags(line);
        return;
    }
    const size_t colon = line.find(':');
    if (colon == std::string_view::npos) {
        return;
    }
    const std::string_view name = line.substr(0, colon);
    for (size_t tried = 0; tried < kFields.size(); ++tried) {
        const size_t index = (_nextField + tried) % kFields.size();
        if (kFields[index].name == name) {
            Vma& vma = _vmas.back();
            // Counts are added up later on: what a mapping cannot hold must not wrap.
            vma.*kFields[index].bytes =
                std::min(parseKilobytes(line.substr(colon + 1)).value_or(0), vma.size());
            vma.hasCounts = true;
            _nextField = index + 1;
            return;
        }
    }
}

// The text of a large process is tens of megabytes, so it is parsed as it comes. The kernel hands out a page
// of text at a time and lets go of the process's memory map in between.
bool readMappings(int processDirectory, const char* file, std::vector<Vma>& vmas) {
    constexpr size_t kBufferSize = 256U << 10U;
    thread_local const std::unique_ptr<char[]> buffer(new char[kBufferSize]);
    const Descriptor text = open(processDirectory, file);
    if (!text) {
        return false;
    }
    SmapsParser parser(std::move(vmas));
    ptrdiff_t count = 0;
    while ((count = readSome(text.get(), {buffer.get(), kBufferSize})) > 0) {
        parser.feed({buffer.get(), static_cast<size_t>(count)});
    }
    const int error = errno;
    vmas = parser.finish();
    errno = error;
    return count == 0;
}

std::vector<Vma> parseSmaps(std::string_view text) {
    SmapsParser parser;
    parser.feed(text);
    return parser.finish();
}

}  // namespace procfs

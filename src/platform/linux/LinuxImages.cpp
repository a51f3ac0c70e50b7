#include "platform/linux/LinuxImages.h"

#include <map>
#include <string_view>
#include <tuple>
#include <utility>

namespace {

using procfs::Vma;

constexpr const char* kText = "__TEXT";
constexpr const char* kConstData = "__DATA_CONST";
constexpr const char* kData = "__DATA";

/// With the path, since two file systems can use an inode under one device number (subvolumes).
using FileKey = std::tuple<uint64_t, uint64_t, std::string_view>;

struct FileState {
    size_t image = LinuxImages::kNoImage;
    bool codeSeen = false;
};

FileKey keyOf(const Vma& vma) {
    return {vma.device(), vma.inode, vma.path};
}

bool isPrivateFile(const BackedVma& backed) {
    return backed.backing == Backing::file && !backed.vma.shared;
}

bool isPlainData(const Vma& vma) {
    return vma.readable && vma.writable && !vma.executable && !vma.shared;
}

bool isBss(const BackedVma& before, const BackedVma& backed) {
    return isPrivateFile(before) && isPlainData(before.vma) && before.vma.end == backed.vma.start &&
           backed.backing == Backing::anonymous && backed.vma.path.empty() && isPlainData(backed.vma);
}

bool hasWrittenPages(const Vma& vma) {
    return vma.anonymous != 0 || vma.swap != 0;
}

// A mapping that was writable once stays charged to the commit limit. Where the flags are not known (every
// readable mapping has some), written pages tell the same; a loader writes behind the code.
bool wasWritten(const Vma& vma, bool codeSeen) {
    return vma.flags != 0 ? vma.has(procfs::VmFlagAccountable) : codeSeen && hasWrittenPages(vma);
}

// Whether `vma` goes on in the file where `before` ends.
bool continues(const Vma& vma, const Vma& before) {
    return before.end == vma.start && before.offset + before.size() == vma.offset &&
           before.inode == vma.inode && before.device() == vma.device();
}

// None for a mapping without access: it only keeps its place.
const char* segmentName(const Vma& vma, bool codeSeen) {
    if (vma.writable) {
        return kData;
    }
    if (vma.executable) {
        return kText;
    }
    if (!vma.readable) {
        return nullptr;
    }
    return wasWritten(vma, codeSeen) ? kConstData : kText;
}

/// Takes the mappings one after the other.
class ImageCollector {
public:
    explicit ImageCollector(const std::vector<BackedVma>& vmas) {
        for (const BackedVma& backed : vmas) {
            if (isPrivateFile(backed) && backed.vma.executable) {
                _files.try_emplace(keyOf(backed.vma));
            }
        }
        _found.imageOfVma.reserve(vmas.size());
    }

    void addFileMapping(const Vma& vma) {
        const auto file = _files.find(keyOf(vma));
        if (file == _files.end()) {
            addOther();
            return;
        }
        FileState& state = file->second;
        state.codeSeen = state.codeSeen || vma.executable;
        if (const char* name = segmentName(vma, state.codeSeen)) {
            _addSegment(_imageOf(state, vma), vma, name);
        } else {
            addOther();
        }
    }

    /// `vma` lies directly behind the mapping added last.
    void addBss(const Vma& vma) {
        const size_t image = _found.imageOfVma.back();
        if (image == LinuxImages::kNoImage) {
            addOther();
        } else {
            _addSegment(image, vma, kData);
        }
    }

    void addOther() { _found.imageOfVma.push_back(LinuxImages::kNoImage); }

    LinuxImages finish() { return std::move(_found); }

private:
    size_t _imageOf(FileState& state, const Vma& vma) {
        if (state.image == LinuxImages::kNoImage) {
            state.image = _found.images.size();
            _found.images.push_back({.path = vma.path, .device = vma.device(), .inode = vma.inode});
        }
        return state.image;
    }

    void _addSegment(size_t image, const Vma& vma, const char* name) {
        _found.images[image].segments.push_back({.start = vma.start, .size = vma.size(), .name = name});
        _found.imageOfVma.push_back(image);
    }

    std::map<FileKey, FileState> _files;  ///< those with an executable part
    LinuxImages _found;
};

}  // namespace

LinuxImages imagesOfVmas(const std::vector<BackedVma>& vmas) {
    ImageCollector collector(vmas);
    for (size_t index = 0; index < vmas.size(); ++index) {
        const BackedVma& backed = vmas[index];
        if (isPrivateFile(backed)) {
            collector.addFileMapping(backed.vma);
        } else if (index > 0 && isBss(vmas[index - 1], backed)) {
            collector.addBss(backed.vma);
        } else {
            collector.addOther();
        }
    }
    return collector.finish();
}

// Constants of which the loader wrote none would lie in the same segment of the file as the data behind them.
bool imagesNeedFlags(const std::vector<BackedVma>& vmas) {
    for (size_t index = 1; index < vmas.size(); ++index) {
        const Vma& before = vmas[index - 1].vma;
        const Vma& vma = vmas[index].vma;
        if (isPrivateFile(vmas[index]) && isPlainData(vma) && isPrivateFile(vmas[index - 1]) &&
            before.readable && !before.writable && !before.executable && !hasWrittenPages(before) &&
            continues(vma, before)) {
            return true;
        }
    }
    return false;
}

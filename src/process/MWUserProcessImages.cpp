#include <algorithm>

#include "platform/MWHostInterface.h"
#include "process/MWUserProcess.h"

namespace {

/// "unknown" where the listing gives the segment no name.
MWSharedText segmentName(std::string_view listed) {
    static const auto text = std::make_shared<const std::string>("__TEXT");
    static const auto unknown = std::make_shared<const std::string>("unknown");
    if (listed == "MACH_HEADER") {
        return text;
    }
    // What follows the name is a remark of the listing service.
    const std::string_view name = listed.substr(0, listed.find(' '));
    return name.empty() ? unknown : MWInternSegmentName(name);
}

}  // namespace

void MWUserProcess::_gatherImageData() {
    MWHostInterface::current().forEachImage(*_task, [this](const MWImageDescription& image) {
        const MWSharedText ownerPath = _ownerPath(image);
        image.forEachSegment([&](const MWImageSegmentDescription& segment) {
            MWImage& added = _images->emplace_back();
            added.setStart(segment.start);
            added.setSize(segment.length);
            added.setName(segmentName(segment.name));
            added.setOwnerPath(ownerPath);
        });
    });
    std::ranges::stable_sort(*_images, {}, &MWImage::start);
}

// Only the images of the shared cache are at the same address in every process; others would fill the table
// of paths with one copy for each address. The host has resolved the links of their paths.
MWSharedText MWUserProcess::_ownerPath(const MWImageDescription& image) const {
    if (_isInSharedCache(image.baseAddress())) {
        return MWInternPath(image.path(), image.baseAddress());
    }
    return std::make_shared<const std::string>(image.path());
}

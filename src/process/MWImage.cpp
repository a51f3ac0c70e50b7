#include "process/MWImage.h"

#include <utility>

#include "model/MWMemoryRegion.h"

MWSharedText MWImage::_noText() {
    static const auto& none = *new std::string;
    return MWUncountedText(none);
}

void MWImage::setName(MWSharedText name) {
    _name = std::move(name);
    if (_name->starts_with("__TEXT") || _name->starts_with("__OBJC_RO")) {
        _segment = SegmentText;
    } else if (_name->starts_with("__LINKEDIT")) {
        _segment = SegmentLinkedit;
    } else if (_name->starts_with("__")) {
        _segment = SegmentData;
    }
}

const MWImage* MWImageEnumerator::nextImageForStart(uint64_t start, MWImageSearch search) {
    const uint64_t end = search.end;
    for (; _index < _images->size(); ++_index) {
        const MWImage& image = (*_images)[_index];
        const bool coversStart = image.start() <= start && start < image.end();
        const bool coversEnd = image.start() < end && end <= image.end();
        const bool inside = start <= image.start() && image.end() <= end;
        if (coversStart || coversEnd || inside) {
            return &image;
        }
        if (image.start() >= start) {
            return nullptr;
        }
    }
    return nullptr;
}

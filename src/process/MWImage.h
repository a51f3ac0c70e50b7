#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "process/MWInterningTables.h"

/// One segment of a loaded image: [start, end) in bytes, its name and the path of the image.
class MWImage {
public:
    /// Segment kind (MWSegmentKind), from the name.
    uint8_t segment() const { return _segment; }
    uint64_t start() const { return _start; }
    void setStart(uint64_t start) { _start = start; }
    uint64_t size() const { return _size; }
    void setSize(uint64_t size) { _size = size; }
    uint64_t end() const { return _start + _size; }
    const MWSharedText& name() const { return _name; }
    /// Also sets the kind; a name that does not begin with two underscores leaves the kind as it is. The text
    /// (never null) is shared with its other holders.
    void setName(MWSharedText name);
    const MWSharedText& ownerPath() const { return _ownerPath; }
    void setOwnerPath(MWSharedText ownerPath) { _ownerPath = std::move(ownerPath); }

private:
    static MWSharedText _noText();

    uint8_t _segment = 0;
    uint64_t _start = 0;
    uint64_t _size = 0;
    MWSharedText _name = _noText();
    MWSharedText _ownerPath = _noText();
};

/// Ascending by start.
using MWImageList = std::vector<MWImage>;

struct MWImageSearch {
    uint64_t end;
};

/// Walks a list of images in step with an ascending walk of regions, so that all lookups of one walk
/// together cost one pass over the images.
class MWImageEnumerator {
public:
    /// (initWithImages:)
    explicit MWImageEnumerator(std::shared_ptr<const MWImageList> images) : _images(std::move(images)) {}

    /// The first image from the cursor on that overlaps [start, end), or none. `start` never decreases from
    /// one call to the next; images wholly below it are left behind. The image stays the list's.
    const MWImage* nextImageForStart(uint64_t start, MWImageSearch search);

private:
    std::shared_ptr<const MWImageList> _images;
    size_t _index = 0;
};

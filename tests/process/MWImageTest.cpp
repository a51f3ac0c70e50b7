#include "process/MWImage.h"

#include <gtest/gtest.h>

#include "model/MWMemoryRegion.h"

namespace {

MWImage image(uint64_t start, uint64_t end) {
    MWImage result;
    result.setStart(start);
    result.setSize(end - start);
    return result;
}

TEST(MWImageTest, EnumeratorFindsOverlapAndLeavesBehindWhatIsBelow) {
    const auto images =
        std::make_shared<const MWImageList>(MWImageList{image(0x1000, 0x2000), image(0x3000, 0x4000)});
    struct Search {
        uint64_t start;
        uint64_t end;
        uint64_t found;  ///< start of the image, 0 for none
    };
    const auto run = [&](const std::vector<Search>& searches) {
        MWImageEnumerator enumerator(images);
        for (const Search& search : searches) {
            const MWImage* found = enumerator.nextImageForStart(search.start, {.end = search.end});
            EXPECT_EQ(found == nullptr ? 0 : found->start(), search.found)
                << std::hex << search.start << " to " << search.end;
        }
    };
    run({{0x2000, 0x2800, 0}, {0x2800, 0x3800, 0x3000}, {0x3800, 0x5000, 0x3000}, {0x4000, 0x5000, 0}});
    run({{0, 0x1000, 0}, {0, 0x1001, 0x1000}, {0, 0x9000, 0x1000}, {0x1FFF, 0x2000, 0x1000}});
    run({{0x2000, 0x2800, 0}, {0x1000, 0x2000, 0}});  // going back finds nothing any more
}

}  // namespace

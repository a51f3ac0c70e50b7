#include "platform/linux/PageDispositions.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <unistd.h>

#include <cstdlib>
#include <string>
#include <vector>

namespace {

constexpr uint64_t kPage = 4096;
constexpr int32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT;
constexpr int32_t kDirty = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY;
constexpr int32_t kFile = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_EXTERNAL;
constexpr int32_t kReusable = VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_REUSABLE;
constexpr int32_t kPagedOut = VM_PAGE_QUERY_PAGE_PAGED_OUT;

constexpr PagemapEntry absent = {0};
constexpr PagemapEntry swapped = {(uint64_t{1} << 62U) | 77};
PagemapEntry anonymous(uint64_t frame = 0) {
    return {(uint64_t{1} << 63U) | frame};
}
PagemapEntry file(uint64_t frame = 0) {
    return {(uint64_t{1} << 63U) | (uint64_t{1} << 61U) | frame};
}

AddressSpaceRegion regionOf(Backing backing, uint64_t dirtyFileBytes = 0, uint64_t lazilyFreedBytes = 0) {
    return {.start = 0x10000,
            .size = 16 * kPage,
            .info = {},
            .backing = backing,
            .dirtyFileBytes = dirtyFileBytes,
            .lazilyFreedBytes = lazilyFreedBytes};
}

std::vector<int32_t> words(PageDispositions& pages, const AddressSpaceRegion& region, uint64_t address,
                           const std::vector<PagemapEntry>& entries, const PageFrameFlags& frames) {
    std::vector<int32_t> result(entries.size(), -1);
    pages.fill(region, address, entries, frames, kPage, result);
    return result;
}

/// A recorded `kpageflags`: the flags of frames 0, 1, 2 ...
PageFrameFlags recordedFlags(const std::vector<uint64_t>& flags) {
    std::string path = testing::TempDir() + "kpageflags-XXXXXX";
    const int descriptor = mkstemp(path.data());
    unlink(path.c_str());
    EXPECT_EQ(write(descriptor, flags.data(), flags.size() * 8), static_cast<ssize_t>(flags.size() * 8));
    return PageFrameFlags(procfs::Descriptor(descriptor));
}

const PageFrameFlags none{procfs::Descriptor()};

using Words = std::vector<int32_t>;

TEST(PageDispositions, KindsOfPages) {
    const std::vector<PagemapEntry> entries = {absent, swapped, anonymous(), file()};
    PageDispositions pages;
    EXPECT_EQ(words(pages, regionOf(Backing::file), 0x10000, entries, none),
              (Words{0, kPagedOut, kDirty, kFile}));
    EXPECT_EQ(words(pages, regionOf(Backing::shmem), 0x10000, entries, none),
              (Words{0, kPagedOut, kDirty, kDirty}));
    EXPECT_EQ(words(pages, regionOf(Backing::special), 0x10000, entries, none),
              (Words{0, kPagedOut, kPresent, kPresent}));
}

TEST(PageDispositions, WithoutFrameFlagsTheRegionsCountsDecideInOrder) {
    PageDispositions pages;
    const AddressSpaceRegion region = regionOf(Backing::file, 3 * kPage);
    EXPECT_EQ(words(pages, region, 0x10000, {file(), absent, file()}, none),
              (Words{kFile | kDirty, 0, kFile | kDirty}));
    EXPECT_EQ(words(pages, region, 0x13000, {file(), file()}, none), (Words{kFile | kDirty, kFile}))
        << "a call that goes on keeps counting";
    EXPECT_EQ(words(pages, region, 0x10000, {file()}, none), (Words{kFile | kDirty})) << "and starts anew";

    const AddressSpaceRegion freed = regionOf(Backing::anonymous, 0, kPage);
    EXPECT_EQ(words(pages, freed, 0x10000, {anonymous(), anonymous()}, none), (Words{kReusable, kDirty}));
}

TEST(PageDispositions, SwappedShmemLooksAbsent) {
    PageDispositions pages;
    AddressSpaceRegion region = regionOf(Backing::shmem);
    region.info.pages_swapped_out = 1;
    EXPECT_EQ(words(pages, region, 0x10000, {absent, file(), absent}, none), (Words{kPagedOut, kDirty, 0}));
    EXPECT_EQ(words(pages, regionOf(Backing::file), 0x10000, {absent}, none), (Words{0}));

    region.info.pages_swapped_out = 4;
    Words hole(3);
    pages.fillHole(region, region.start, kPage, hole);
    EXPECT_EQ(hole, (Words{kPagedOut, kPagedOut, kPagedOut}));
    const uint64_t behind = region.start + 3 * kPage;
    EXPECT_EQ(words(pages, region, behind, {file(), absent, absent}, none), (Words{kDirty, kPagedOut, 0}))
        << "the count goes on behind a hole";
}

TEST(PageDispositions, FrameFlagsSayWhichPagesTheyAre) {
    using F = PageFrameFlags;
    const PageFrameFlags frames =
        recordedFlags({0, F::kDirty, 0, F::kAnonymous | F::kSwapBacked, F::kAnonymous, F::kDirty});
    PageDispositions pages;
    EXPECT_EQ(words(pages, regionOf(Backing::file, kPage), 0x10000, {file(2), file(1), file(9)}, frames),
              (Words{kFile, kFile | kDirty, kFile}));
    EXPECT_EQ(words(pages, regionOf(Backing::file), 0x10000, {file(1)}, frames), (Words{kFile}))
        << "a mapping without dirty file pages is not looked up";
    EXPECT_EQ(
        words(pages, regionOf(Backing::anonymous, 0, kPage), 0x10000, {anonymous(3), anonymous(4)}, frames),
        (Words{kDirty, kReusable}));
}

}  // namespace

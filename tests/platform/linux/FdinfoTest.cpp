#include "platform/linux/Fdinfo.h"

#include <gtest/gtest.h>

#include "platform/linux/MemoryMounts.h"
#include "platform/linux/SysVSegments.h"

namespace {

constexpr uint64_t kKiB = 1024;
constexpr uint64_t kMiB = 1024 * kKiB;

constexpr std::string_view kPurgeableClient =
    "pos:\t0\nflags:\t02400002\nmnt_id:\t26\nino:\t512\n"
    "drm-driver:\tpanfrost\n"
    "drm-client-id:\t3\n"
    "drm-total-memory:\t12 MiB\n"
    "drm-shared-memory:\t4 MiB\n"
    "drm-active-memory:\t0\n"
    "drm-resident-memory:\t9220 KiB\n"
    "drm-purgeable-memory:\t4097\n";

TEST(DrmClient, CountsSystemMemoryAlone) {
    const auto client = procfs::parseDrmClient(
        "drm-driver:\txe\n"
        "drm-client-id:\t41\n"
        "drm-pdev:\t0000:03:00.0\n"
        "drm-total-gtt:\t384 KiB\n"
        "drm-resident-gtt:\t384 KiB\n"
        "drm-total-system:\t8 MiB\n"
        "drm-resident-system:\t4 MiB\n"
        "drm-total-stolen-system0:\t64 KiB\n"
        "drm-total-stolen-local0:\t32 MiB\n"
        "drm-total-vram0:\t96 MiB\n"
        "drm-shared-vram0:\t16 MiB\n"
        "drm-resident-vram0:\t81924 KiB\n"
        "drm-total-cycles-rcs:\t987654321\n");
    ASSERT_TRUE(client);
    EXPECT_EQ(client->device, "0000:03:00.0");
    EXPECT_EQ(client->identifier, 41U);
    EXPECT_EQ(client->resident, 4 * kMiB + (384 + 64) * kKiB);
    EXPECT_EQ(client->total, 8 * kMiB + (384 + 64) * kKiB);
}

TEST(DrmClient, ReadsTheOldNameOfResidentBytesAndPurgeableOnes) {
    const auto old = procfs::parseDrmClient(
        "drm-driver:\tamdgpu\n"
        "drm-client-id:\t9\n"
        "drm-pdev:\t0000:0b:00.0\n"
        "drm-memory-vram:\t20480 KiB\n"
        "drm-memory-gtt: \t6144 KiB\n"
        "amd-requested-vram:\t20480 KiB\n"
        "drm-shared-vram:\t8192 KiB\n");
    ASSERT_TRUE(old);
    EXPECT_EQ(old->resident, 6144 * kKiB);
    const auto both = procfs::parseDrmClient(
        "drm-driver:\tamdgpu\ndrm-client-id:\t9\ndrm-memory-gtt:\t6 MiB\ndrm-resident-gtt:\t5 MiB\n");
    ASSERT_TRUE(both);
    EXPECT_EQ(both->resident, 5 * kMiB) << "two names of one figure are never added";
    EXPECT_EQ(both->device, "amdgpu");
    const auto purgeable = procfs::parseDrmClient(kPurgeableClient);
    ASSERT_TRUE(purgeable);
    EXPECT_EQ(purgeable->resident, 9220 * kKiB);
    EXPECT_EQ(purgeable->purgeable, 4097U);
}

TEST(DrmClient, IsNoneWhereNothingTellsItFromOthers) {
    EXPECT_FALSE(procfs::parseDrmClient(""));
    EXPECT_FALSE(procfs::parseDrmClient("drm-driver:\tvgem\ndrm-total-memory:\t1 MiB\n"));
    EXPECT_FALSE(procfs::parseDrmClient("drm-driver:\tvgem\ndrm-client-id:\t-4\n"));
}

TEST(Fdinfo, FiguresThatMakeNoSenseArePassedOver) {
    const auto client = procfs::parseDrmClient(
        "drm-driver:\ti915\ndrm-client-id:\t1\n"
        "drm-resident-system0:\t18446744073709551615 KiB\n"
        "drm-total-system0:\t99999999999999999999999\n"
        "drm-purgeable-system0:\t7 parsecs\n"
        "drm-resident-gtt:\n:\n\n::\ndrm-resident-cpu");
    ASSERT_TRUE(client);
    EXPECT_EQ(client->resident + client->total + client->purgeable, 0U);
    const auto huge = procfs::parseDrmClient(
        "drm-driver:\ti915\ndrm-client-id:\t1\n"
        "drm-resident-gtt:\t18446744073709551615\ndrm-resident-cpu:\t18446744073709551615\n");
    ASSERT_TRUE(huge);
    EXPECT_EQ(huge->resident, UINT64_MAX);
    for (size_t length = 0; length < kPurgeableClient.size(); ++length) {
        const auto cut = procfs::parseDrmClient(kPurgeableClient.substr(0, length));
        EXPECT_LE(cut ? cut->purgeable : 0, cut ? cut->resident : 0) << length;
    }
}

TEST(Fdinfo, BuffersAndMapsOfOtherKinds) {
    const auto camera = procfs::parseDmaBuffer(
        "pos:\t0\nflags:\t02\nsize:\t8294400\ncount:\t3\nexp_name:\tvideobuf2_dma_contig\nname:\tcam\n");
    ASSERT_TRUE(camera);
    EXPECT_EQ(camera->size, 8294400U);
    EXPECT_TRUE(camera->fromVideoDevice);
    const auto heap = procfs::parseDmaBuffer("size:\t4096\ncount:\t1\nexp_name:\tsystem\n");
    ASSERT_TRUE(heap);
    EXPECT_FALSE(heap->fromVideoDevice);
    EXPECT_FALSE(procfs::parseDmaBuffer("count:\t1\nexp_name:\tsystem\n"));
    const auto forged = procfs::parseDmaBuffer(
        "size:\t4096\ncount:\t1\nexp_name:\tsystem\nname:\ta\nsize:\t18446744073709551615\nexp_name:\tvb2\n");
    ASSERT_TRUE(forged);
    EXPECT_EQ(forged->size, 4096U) << "whatever a process calls its buffer";
    EXPECT_FALSE(forged->fromVideoDevice);

    const auto map = procfs::parseBpfMap(
        "pos:\t0\nmap_type:\t2\nkey_size:\t4\nmax_entries:\t1024\nmemlock:\t8576\nmap_id:\t17\nfrozen:\t0\n");
    ASSERT_TRUE(map);
    EXPECT_EQ(map->identifier, 17U);
    EXPECT_EQ(map->memory, 8576U);
    EXPECT_FALSE(procfs::parseBpfMap("memlock:\t8576\n"));
}

TEST(SysVSegments, ColumnsAreFoundByTheirHeadings) {
    const auto segments = procfs::parseSysVSegments(
        "       key      shmid perms                  size  cpid  lpid nattch   uid   gid  cuid  cgid      "
        "atime      dtime      ctime                   rss                  swap\n"
        "         0          5  1600               1048576  2051  2052      1     0     0     0     0 "
        "1700000001          0 1700000000                  4096                     0\n"
        "         0          6  1600               2097152  2051     0      0     0     0     0     0 "
        "         0          0 1700000007                  8192                 12288\n"
        "         0          7  1600               2097152  20\n");
    ASSERT_EQ(segments.size(), 2U);
    EXPECT_EQ(segments[0].attached, 1U);
    EXPECT_EQ(segments[1].identifier, 6U);
    EXPECT_EQ(segments[1].size, 2097152U);
    EXPECT_EQ(segments[1].creator, 2051);
    EXPECT_EQ(segments[1].changeTime, 1700000007U);
    EXPECT_EQ(segments[1].resident, 8192U);
    EXPECT_EQ(segments[1].swapped, 12288U);
    EXPECT_TRUE(procfs::parseSysVSegments("key shmid size\n0 1 4096\n").empty());
    EXPECT_TRUE(procfs::parseSysVSegments("").empty());
}

TEST(MemoryMounts, TheInnermostMountDecides) {
    const MemoryMounts mounts(
        "20 1 254:0 / / rw - ext4 /dev/vda rw\n"
        "24 20 0:34 / /dev/shm rw,nosuid shared:3 - tmpfs tmpfs rw\n"
        "25 20 0:35 / /run rw - tmpfs tmpfs rw\n"
        "26 25 254:1 /some/root /run/media/a\\040disk rw - ext4 /dev/vdb rw\n"
        "27 20 0:36 / /srv rw - tmpfs tmpfs rw\n"
        "28 27 254:2 / /srv rw - xfs /dev/vdc rw\n"
        "29 20 0:37 / /huge rw - hugetlbfs none rw\n"
        "30 20 0:38 / /cut");
    EXPECT_TRUE(mounts.hold("/dev/shm/cache (deleted)"));
    EXPECT_TRUE(mounts.hold("/run/x"));
    EXPECT_TRUE(mounts.hold("/huge/pages"));
    EXPECT_FALSE(mounts.hold("/run/media/a disk/file"));
    EXPECT_FALSE(mounts.hold("/runner/x"));
    EXPECT_FALSE(mounts.hold("/srv/x")) << "the later mount lies above the earlier one";
    EXPECT_FALSE(mounts.hold("/etc/passwd"));
    EXPECT_FALSE(MemoryMounts("").hold("/dev/shm/x"));
    EXPECT_TRUE(MemoryMounts("20 1 0:2 / / rw - tmpfs rootfs rw\n").hold("/x"));
    EXPECT_EQ(mounts.ofDevice(34), MemoryFileSystem::shmem);
    EXPECT_EQ(mounts.ofDevice(37), MemoryFileSystem::hugetlb);
    EXPECT_EQ(mounts.ofDevice(uint64_t{254} << 32U), MemoryFileSystem::none);
    EXPECT_EQ(mounts.ofDevice(99), MemoryFileSystem::none);
    const MemoryMounts jail("20 1 0:34 / /dev rw - devtmpfs dev rw\n21 1 254:0 / / rw - ext4 x rw\n",
                            "/srv/jail");
    EXPECT_TRUE(jail.hold("/srv/jail/dev/x"));
    EXPECT_FALSE(jail.hold("/srv/jail/x"));
    EXPECT_FALSE(jail.hold("/dev/x")) << "outside of the root that the mounts are seen from";
}

}  // namespace

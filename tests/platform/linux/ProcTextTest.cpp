#include "platform/linux/ProcText.h"

#include <gtest/gtest.h>

#include <string>

#include "platform/linux/ShmemDevices.h"

namespace {

using namespace std::string_literals;

const std::string kStatTail =
    " S 7 1 1 0 -1 4194560 100 200 0 0 1 2 3 4 20 0 5 0 8812 1000000 50 18446744073709551615 1 2 140736 0 "
    "0\n";

TEST(ProcText, StatFieldsAreCountedFromTheLastParenthesis) {
    for (const std::string& comm : {"bash"s, "a) S 99 (b"s, "((sd-pam))"s, " "s, ""s}) {
        const auto stat = procfs::parseStat("812 (" + comm + ")" + kStatTail);
        ASSERT_TRUE(stat.has_value()) << comm;
        EXPECT_EQ(stat->pid, 812);
        EXPECT_EQ(stat->comm, comm);
        EXPECT_EQ(stat->ppid, 7);
        EXPECT_EQ(stat->flags, 4194560U);
        EXPECT_EQ(stat->threads, 5U);
        EXPECT_EQ(stat->startTime, 8812U);
        EXPECT_EQ(stat->startStack, 140736U);
        EXPECT_FALSE(stat->isKernelThread());
    }
    EXPECT_TRUE(
        procfs::parseStat("2 (kthreadd) S 0 0 0 0 -1 2129984 0 0 0 0 0 0 0 0 20 0 1 0 1 0 0 0 0 0 0 0")
            ->isKernelThread());
}

TEST(ProcText, AThreadThatIsEndingHasEnded) {
    auto stat = *procfs::parseStat("812 (x)" + kStatTail);
    EXPECT_FALSE(stat.threadEnded());
    stat.flags |= 4;  // PF_EXITING: the memory may be gone while the state still says that it runs
    EXPECT_TRUE(stat.threadEnded());
}

TEST(ProcText, WithoutAddressRandomisationOnlyItsSizeTellsAnotherProgram) {
    const auto stat = *procfs::parseStat("812 (x)" + kStatTail);
    auto other = stat;
    EXPECT_TRUE(stat.isSameProgramAs(other));
    other.endCode += 1;
    EXPECT_FALSE(stat.isSameProgramAs(other));
}

TEST(ProcText, EveryCutOfAStatLineIsRefusedOrRead) {
    const std::string line = "812 (a) b)" + kStatTail;
    for (size_t length = 0; length < line.size(); ++length) {
        const auto stat = procfs::parseStat(std::string_view(line).substr(0, length));
        EXPECT_TRUE(!stat || stat->startTime == 8812U) << length;
    }
    EXPECT_FALSE(procfs::parseStat("x (a) S 1 1 1"));
    EXPECT_FALSE(procfs::parseStat("1 (a)  S 1"));
    EXPECT_FALSE(procfs::parseStat(")("));
}

TEST(ProcText, StatusCountsMissingAndBrokenLinesAsNothing) {
    const auto status = procfs::parseStatus(
        "Name:\tVmSwap:\nVmHWM:\t    2048 kB\nRssAnon:\t     100 kB\nRssFile:\t 7 kB\nRssShmem:\t-3 kB\n"
        "VmPTE:\t      64 kB\nVmSwap:\t 99999999999999999 kB\nHugetlbPages:\t  12");
    EXPECT_EQ(status.vmHwm, 2048U * 1024);
    EXPECT_EQ(status.rssAnon, 100U * 1024);
    EXPECT_EQ(status.vmPte, 64U * 1024);
    EXPECT_EQ(status.rssShmem, 0U);
    EXPECT_EQ(status.vmSwap, 0U);
    EXPECT_EQ(status.hugetlbPages, 0U) << "no unit";
}

TEST(ProcText, CommandLineNames) {
    EXPECT_EQ(procfs::nameFromCommandLine("/usr/bin/bash\0-c\0"s), "bash");
    for (const std::string& title : {"sshd: root@pts/0\0"s, "nginx worker"s, ""s}) {
        EXPECT_EQ(procfs::nameFromCommandLine(title), "") << title;
    }
}

TEST(ProcText, Namespaces) {
    EXPECT_EQ(procfs::parseNamespace("mnt:[4026531841]"), 4026531841U);
    for (const char* other : {"", "mnt:", "mnt:[", "mnt:[x]", "mnt:[5", "mnt:[5]]"}) {
        EXPECT_EQ(procfs::parseNamespace(other), 0U) << other;
    }
}

TEST(ProcText, AuxvTellsTheWidth) {
    // AT_SYSINFO_EHDR (33) with an address, in both widths.
    EXPECT_EQ(procfs::auxvIs64bit("\x21\0\0\0\0\0\0\0\0\0\xfe\xf7\x7f\0\0\0"s), true);
    EXPECT_EQ(procfs::auxvIs64bit("\x21\0\0\0\0\xd0\xf7\xf7"s), false);
    EXPECT_EQ(procfs::auxvIs64bit("\x21\0\0"s), std::nullopt);
}

TEST(ProcText, MountinfoWithTagsAndCutLines) {
    const auto mounts = procfs::parseMountinfo(
        "24 23 0:22 / /dev/shm rw,relatime shared:4 - tmpfs tmpfs rw\n"
        "25 23 0:9999999999999999999999 / /x rw - tmpfs t rw\n"
        "26 1 254:0 / / rw - ext4 /dev/vda rw\n"
        "27 1 0:30 / /mnt rw - tm");
    ASSERT_EQ(mounts.size(), 3U);
    EXPECT_EQ(mounts[0].device, 22U);
    EXPECT_EQ(mounts[0].fileSystem, "tmpfs");
    EXPECT_EQ(mounts[1].device, uint64_t{254} << 32U);
    EXPECT_EQ(mounts[2].fileSystem, "tm");
}

}  // namespace

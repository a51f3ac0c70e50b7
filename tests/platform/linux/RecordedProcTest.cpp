#include <gtest/gtest.h>

#include <string>

#include "platform/linux/ForkFamily.h"
#include "platform/linux/MWLinuxHost.h"
#include "platform/linux/Procfs.h"
#include "platform/linux/ShmemDevices.h"
#include "support/RecordedTree.h"

// Trees of recorded files in the place of procfs.

namespace {

class RecordedProc : public RecordedTree {
protected:
    void writeProcess(const std::string& pid, const std::string& stat, const std::string& smaps) {
        write(pid + "/stat", stat);
        write(pid + "/maps", "");
        write(pid + "/smaps", smaps);
    }
};

std::string statOf(int pid, char state, uint64_t flags, int threads, int parent = 1) {
    return std::to_string(pid) + " (x) " + state + " " + std::to_string(parent) + " 1 1 0 -1 " +
           std::to_string(flags) + " 0 0 0 0 0 0 0 0 20 0 " + std::to_string(threads) +
           " 0 500 0 0 0 1 2 3 0 0\n";
}

kern_return_t walkOf(MWLinuxHost& host, int32_t pid) {
    task_t task = 0;
    EXPECT_EQ(host.task_read_for_pid(pid, task), KERN_SUCCESS);
    uint64_t address = 0;
    uint64_t size = 0;
    uint32_t depth = 0;
    uint32_t words = VM_REGION_SUBMAP_INFO_COUNT_64;
    vm_region_submap_info_64 info;
    const kern_return_t code = host.mach_vm_region_recurse(task, address, size, depth, info, words);
    host.task_release(task);
    return code;
}

TEST_F(RecordedProc, AProcessBeingTornDownIsGoneThoughItStillRuns) {
    constexpr uint64_t kExiting = 4;
    writeProcess("20", statOf(20, 'R', kExiting, 1), "");
    write("20/task/20/stat", statOf(20, 'R', kExiting, 1));
    writeProcess("21", statOf(21, 'S', 0, 1), "");
    write("21/task/21/stat", statOf(21, 'S', 0, 1));
    MWLinuxHost host(_top);
    EXPECT_EQ(walkOf(host, 20), MACH_SEND_INVALID_DEST);
    proc_bsdshortinfo record = {};
    EXPECT_GT(host.proc_pidinfo(20, record), 0);
    EXPECT_EQ(record.pbsi_status, SZOMB) << "so that it is a warning, no error";
    EXPECT_EQ(walkOf(host, 21), KERN_INVALID_ADDRESS) << "alive, with no memory of its own";
}

TEST_F(RecordedProc, AProcessIsReadThroughAThreadThatLives) {
    writeProcess("20", statOf(20, 'Z', 4, 2), "");
    write("20/task/20/stat", statOf(20, 'Z', 4, 2));
    writeProcess("20/task/22", statOf(22, 'S', 0, 2),
                 "1000-3000 rw-p 00000000 00:00 0\nRss: 8 kB\nAnonymous: 8 kB\nPrivate_Dirty: 8 kB\n");
    MWLinuxHost host(_top);
    EXPECT_EQ(walkOf(host, 20), KERN_SUCCESS);
}

TEST_F(RecordedProc, ParentsThatLeadBackToTheirChildrenAreNoEndlessChain) {
    const auto family = [this](int32_t pid) {
        return forkFamilyIdentifier(directory("").get(), directory(std::to_string(pid)).get(), pid,
                                    ObjectIdentity("boot"));
    };
    // Beyond the largest pid: nothing is read of a real process.
    const auto writeChild = [this](int32_t pid, int32_t parent, const char* executable) {
        const std::string name = std::to_string(pid);
        write(name + "/stat", statOf(pid, 'S', 0, 1, parent));
        if (executable != nullptr) {
            link(name + "/exe", executable);
        }
    };
    writeChild(5000001, 5000002, "/bin/server");
    writeChild(5000002, 5000001, "/bin/server");
    EXPECT_NE(family(5000001), 0U);
    writeChild(5000003, 5000004, "/bin/server");
    writeChild(5000004, 5000005, "/bin/server");
    writeChild(5000005, 1, nullptr);
    EXPECT_EQ(family(5000003), family(5000004));
    EXPECT_NE(family(5000004), family(5000005)) << "nobody knows what that one runs";
}

TEST_F(RecordedProc, WhatOneProcessDoesNotSeeAnotherMayHaveMounted) {
    constexpr uint64_t kShm = 0x22;
    write("seeing/mountinfo", "24 23 0:34 / /dev/shm rw - tmpfs tmpfs rw\n");
    link("seeing/ns/mnt", "mnt:[1]");
    write("blind/mountinfo", "20 1 254:0 / / rw - ext4 /dev/vda rw\n");
    link("blind/ns/mnt", "mnt:[2]");
    link("ended/ns/mnt", "mnt:[1]");
    write("ended/cmdline", "");
    ShmemDevices devices;
    EXPECT_FALSE(devices.isShmem(kShm, directory("blind").get()));
    EXPECT_FALSE(devices.isShmem(kShm, directory("ended").get())) << "its mounts cannot be read any more";
    EXPECT_TRUE(devices.isShmem(kShm, directory("seeing").get()));
    EXPECT_TRUE(devices.isShmem(kShm, directory("blind").get())) << "the device is what it is";
    EXPECT_FALSE(devices.isShmem(uint64_t{254} << 32U, directory("seeing").get()));
}

}  // namespace

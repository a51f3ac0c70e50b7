#include "platform/linux/MWLinuxHost.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <linux/sched.h>
#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "support/ChildProcess.h"

namespace {

constexpr uint64_t kPage = 4096;

uint64_t mapPages(size_t pages, int flags, int descriptor = -1) {
    void* address = mmap(nullptr, pages * kPage, PROT_READ | PROT_WRITE, flags, descriptor, 0);
    return reinterpret_cast<uint64_t>(address);
}

void touch(uint64_t address, std::initializer_list<size_t> pages) {
    for (const size_t page : pages) {
        *reinterpret_cast<volatile char*>(address + page * kPage) = 1;
    }
}

/// A task on a live host, released at the end.
class LiveTask {
public:
    LiveTask(MWLinuxHost& host, pid_t pid) : _host(host) { _code = host.task_read_for_pid(pid, _task); }
    ~LiveTask() { _host.task_release(_task); }
    LiveTask(const LiveTask&) = delete;
    LiveTask& operator=(const LiveTask&) = delete;

    kern_return_t code() const { return _code; }
    task_t handle() const { return _task; }

    struct Region {
        kern_return_t code = 0;
        uint64_t start = 0;
        uint64_t size = 0;
        vm_region_submap_info_64 info = {};
    };
    /// The first region at or above `address`.
    Region walk(uint64_t address = 0) const {
        Region region = {.start = address};
        uint32_t depth = 0;
        uint32_t words = VM_REGION_SUBMAP_INFO_COUNT_64;
        region.code =
            _host.mach_vm_region_recurse(_task, region.start, region.size, depth, region.info, words);
        return region;
    }

private:
    MWLinuxHost& _host;
    task_t _task = 0;
    kern_return_t _code;
};

TEST(LinuxHost, CountsExactlyThePagesThatWereTouched) {
    const ChildProcess child([] {
        const uint64_t address = mapPages(20, MAP_PRIVATE | MAP_ANONYMOUS);
        madvise(reinterpret_cast<void*>(address), 20 * kPage, MADV_NOHUGEPAGE);
        touch(address, {0, 7, 19});
        return address;
    });
    MWLinuxHost host;
    const LiveTask task(host, child.pid());
    const auto region = task.walk(child.answer());
    EXPECT_EQ(region.start, child.answer());
    EXPECT_EQ(region.size, 20 * kPage);
    EXPECT_EQ(region.info.pages_resident, 3U);
    EXPECT_EQ(region.info.pages_dirtied, 3U);
    EXPECT_EQ(region.info.share_mode, SM_PRIVATE);

    std::vector<int32_t> words(20);
    uint64_t count = words.size();
    ASSERT_EQ(host.mach_vm_page_range_query(task.handle(), region.start, region.size, words, count),
              KERN_SUCCESS);
    for (size_t page = 0; page < words.size(); ++page) {
        const bool touched = page == 0 || page == 7 || page == 19;
        EXPECT_EQ(words[page], touched ? VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY : 0) << page;
    }
}

TEST(LinuxHost, MappedFilesHaveTheirPath) {
    const std::string path = testing::TempDir() + "a b\n(deleted)";
    std::ofstream(path) << std::string(4 * kPage, 'x');
    const int file = open(path.c_str(), O_RDWR | O_CLOEXEC);
    ASSERT_GE(file, 0);
    const ChildProcess child([&] {
        const uint64_t address = mapPages(4, MAP_SHARED, file);
        touch(address, {3});
        return address;
    });
    close(file);
    MWLinuxHost host;
    const LiveTask task(host, child.pid());
    unlink(path.c_str());
    const auto region = task.walk(child.answer());
    if (region.info.external_pager == 0) {
        GTEST_SKIP() << "the temporary directory is a tmpfs";
    }
    std::array<char, 1024> name = {};
    const int length = host.proc_regionfilename(child.pid(), child.answer(), name);
    EXPECT_EQ(std::string(name.data(), static_cast<size_t>(length)), path);
    EXPECT_EQ(region.info.share_mode, SM_SHARED);
    EXPECT_GE(region.info.pages_dirtied, 1U);
}

TEST(LinuxHost, AProcessThatEndedHasNoAddressSpace) {
    ChildProcess child;
    MWLinuxHost host;
    const LiveTask task(host, child.pid());
    EXPECT_EQ(task.walk().code, KERN_SUCCESS);
    proc_bsdshortinfo record = {};

    child.kill();
    const LiveTask zombie(host, child.pid());
    EXPECT_EQ(zombie.code(), KERN_SUCCESS) << "a zombie can be named, its memory is gone";
    EXPECT_EQ(zombie.walk().code, MACH_SEND_INVALID_DEST);
    EXPECT_EQ(host.proc_pidinfo(child.pid(), record), static_cast<int>(sizeof(record)));
    EXPECT_EQ(record.pbsi_status, SZOMB);

    child.reap();
    EXPECT_EQ(zombie.walk().code, MACH_SEND_INVALID_DEST);
    EXPECT_LT(host.proc_pidinfo(child.pid(), record), 0);
    EXPECT_EQ(errno, ESRCH);
    EXPECT_EQ(LiveTask(host, child.pid()).code(), KERN_FAILURE);
}

// The successor is made with the pid of its predecessor, which only root may ask for.
TEST(LinuxHost, ATaskNeverReadsAnotherProcessOfItsPid) {
    ChildProcess first;
    MWLinuxHost host;
    const LiveTask task(host, first.pid());
    first.reap();
    pid_t wanted = first.pid();
    clone_args arguments = {};
    arguments.exit_signal = SIGCHLD;
    arguments.set_tid = reinterpret_cast<uint64_t>(&wanted);
    arguments.set_tid_size = 1;
    const long successor = syscall(SYS_clone3, &arguments, sizeof(arguments));
    if (successor == 0) {
        pause();
        _exit(0);
    }
    if (successor < 0) {
        GTEST_SKIP() << "not allowed to choose a pid";
    }
    ASSERT_EQ(successor, wanted);
    EXPECT_EQ(task.walk().code, MACH_SEND_INVALID_DEST);
    EXPECT_EQ(LiveTask(host, wanted).walk().code, KERN_SUCCESS);
    kill(wanted, SIGKILL);
    waitpid(wanted, nullptr, 0);
}

TEST(LinuxHost, HolesAreFoundAndTheZeroPageIsNoMemory) {
    const ChildProcess child([] {
        constexpr size_t kPages = 64 << 10;
        const uint64_t address = mapPages(kPages, MAP_PRIVATE | MAP_ANONYMOUS | MAP_NORESERVE);
        madvise(reinterpret_cast<void*>(address), kPages * kPage, MADV_NOHUGEPAGE);
        touch(address, {kPages - 1});
        static_cast<void>(*reinterpret_cast<volatile char*>(address + 5 * kPage));  // maps the zero page
        return address;
    });
    const procfs::Descriptor directory =
        procfs::open(AT_FDCWD, ("/proc/" + std::to_string(child.pid())).c_str(), O_DIRECTORY);
    const PageFrameFlags none{procfs::Descriptor()};
    LivePages pages(directory.get(), {none, 0, kPage});
    if (!pages.knowsHoles()) {
        GTEST_SKIP() << "the kernel cannot scan";
    }
    const uint64_t end = child.answer() + (64 << 10) * kPage;
    EXPECT_EQ(pages.nextPopulated(child.answer(), end), child.answer() + 5 * kPage);
    EXPECT_EQ(pages.nextPopulated(child.answer() + 6 * kPage, end), end - kPage);
    EXPECT_EQ(pages.nextPopulated(child.answer() + 6 * kPage, end - kPage), end - kPage);

    std::vector<PagemapEntry> entries(8);
    ASSERT_TRUE(pages.readPages(child.answer(), entries));
    EXPECT_TRUE(entries[5].present());
    if (entries[5].exclusive()) {
        GTEST_SKIP() << "the kernel gives memory of its own for a read";
    }
    pages.clearZeroPages(child.answer(), entries);
    EXPECT_FALSE(entries[5].present());
}

TEST(LinuxHost, KernelThreadsHaveNoRecordButTheKernelHas) {
    const ChildProcess child;
    MWLinuxHost host;
    std::vector<int32_t> pids(static_cast<size_t>(host.proc_listallpids({})) + 20);
    pids.resize(static_cast<size_t>(host.proc_listallpids(pids)));
    EXPECT_TRUE(std::is_sorted(pids.begin(), pids.end()));
    EXPECT_EQ(pids.front(), 0);
    EXPECT_TRUE(std::binary_search(pids.begin(), pids.end(), child.pid()));
    proc_bsdinfo record = {};
    for (const int32_t pid : pids) {
        std::string text;
        std::getline(std::ifstream("/proc/" + std::to_string(pid) + "/stat"), text);
        const auto stat = procfs::parseStat(text);
        if (stat && stat->isKernelThread()) {
            EXPECT_LT(host.proc_pidinfo(pid, record), 0) << text;
        }
    }
    EXPECT_EQ(host.proc_pidinfo(0, record), 136);
    EXPECT_EQ(record.pbi_flags & PROC_FLAG_SYSTEM, PROC_FLAG_SYSTEM);
    EXPECT_EQ(host.proc_pidinfo(child.pid(), record), 136);
    EXPECT_EQ(record.pbi_flags, PROC_FLAG_LP64);
    EXPECT_EQ(record.pbi_ppid, static_cast<uint32_t>(getpid()));
}

TEST(LinuxHost, ReadsTheKernelsOwnFigures) {
    const ChildProcess child([] {
        touch(mapPages(64, MAP_PRIVATE | MAP_ANONYMOUS), {0, 1, 2, 3, 4, 5, 6, 7});
        return uint64_t{0};
    });
    MWLinuxHost host;
    rusage_info_v5 usage;
    ASSERT_EQ(host.proc_pid_rusage(child.pid(), usage), 0);
    EXPECT_GT(usage.ri_phys_memweight, 8 * kPage);
    EXPECT_GE(usage.ri_lifetime_max_phys_memweight, usage.ri_phys_memweight);

    std::vector<ledger_template_info> names(2);
    std::vector<ledger_entry_info> entries(2);
    size_t filled = 0;
    ASSERT_EQ(host.ledgerTemplate(names, filled), 0);
    ASSERT_EQ(filled, 1U);
    EXPECT_STREQ(names.front().lti_name.data(), "page_table");
    ASSERT_EQ(host.ledgerEntries(child.pid(), entries, filled), 0);
    EXPECT_GT(entries.front().lei_balance, 0);

    std::vector<char> area(4096);
    size_t length = 0;
    ASSERT_EQ(host.sysctlArgumentArea(child.pid(), area, length), 0);
    const std::string path(area.data() + sizeof(int32_t));
    EXPECT_EQ(path.substr(path.rfind('/') + 1), "platform_tests");
    EXPECT_EQ(host.sysctlArgumentArea(child.pid(), std::span(area).first(3), length), 0);
    EXPECT_EQ(length, 3U) << "cut to the room there is";
}

TEST(LinuxHost, RemovesRegularFilesOnly) {
    MWLinuxHost host;
    std::string directory = testing::TempDir() + "memweight-XXXXXX";
    ASSERT_NE(mkdtemp(directory.data()), nullptr);
    const std::string file = directory + "/file";
    const std::string link = directory + "/link";
    std::ofstream(file) << "x";
    ASSERT_EQ(symlink(file.c_str(), link.c_str()), 0);
    for (const std::string& path : {link, directory, std::string("/dev/null")}) {
        host.unlinkRegularFile(path);
        EXPECT_TRUE(host.fileExists(path)) << path;
    }
    host.unlinkRegularFile(file);
    EXPECT_FALSE(host.fileExists(file));
    std::filesystem::remove_all(directory);
}

}  // namespace

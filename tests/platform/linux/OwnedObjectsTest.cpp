#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mman.h>
#include <sys/shm.h>
#include <sys/socket.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <csignal>
#include <cstring>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/MWLinuxHost.h"
#include "support/ChildProcess.h"
#include "support/RecordedTree.h"

// What processes hold without mapping it, as the host reports it.

namespace {

constexpr size_t kMiB = size_t{1} << 20U;

std::vector<OwnedObjectRecord> ownedObjects(MWHostInterface& host, task_t task) {
    size_t length = 0;
    EXPECT_EQ(host.sysctlOwnedVmObjects(task, {}, length), 0);
    std::vector<std::byte> reply(length + 16 * sizeof(OwnedObjectRecord));
    size_t filled = reply.size();
    EXPECT_EQ(host.sysctlOwnedVmObjects(task, reply, filled), 0);
    EXPECT_LT(filled, reply.size());
    if (filled == 0) {
        return {};
    }
    uint64_t count = 0;
    std::memcpy(&count, reply.data(), sizeof(count));
    std::vector<OwnedObjectRecord> records(count);
    EXPECT_EQ(filled, sizeof(count) + count * sizeof(OwnedObjectRecord));
    std::memcpy(records.data(), reply.data() + sizeof(count), count * sizeof(OwnedObjectRecord));
    std::ranges::sort(records, {}, &OwnedObjectRecord::virtual_size);
    return records;
}

/// The processes of one measurement.
class Measured {
public:
    Measured(MWLinuxHost& host, std::vector<int32_t> pids) : _host(host) {
        _host.beginSurvey();
        for (const int32_t pid : pids) {
            task_t task = 0;
            EXPECT_EQ(_host.task_read_for_pid(pid, task), KERN_SUCCESS);
            _tasks.push_back(task);
        }
        for (const task_t task : _tasks) {
            _host.surveyTask(task, true);
        }
    }
    ~Measured() {
        for (const task_t task : _tasks) {
            _host.task_release(task);
        }
    }
    Measured(const Measured&) = delete;
    Measured& operator=(const Measured&) = delete;

    std::vector<OwnedObjectRecord> objectsOf(size_t index) { return ownedObjects(_host, _tasks[index]); }

private:
    MWLinuxHost& _host;
    std::vector<task_t> _tasks;
};

uint64_t totalOf(const std::vector<OwnedObjectRecord>& records) {
    uint64_t bytes = 0;
    for (const OwnedObjectRecord& record : records) {
        bytes += record.resident + record.compressed;
    }
    return bytes;
}

int memoryFile(size_t bytes) {
    const int file = memfd_create("held", MFD_CLOEXEC);
    return file >= 0 && posix_fallocate(file, 0, static_cast<off_t>(bytes)) == 0 ? file : -1;
}

void* mapAndTouch(int file, size_t bytes) {
    void* address = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_SHARED, file, 0);
    std::memset(address, 1, bytes);
    return address;
}

TEST(OwnedObjects, FilesInMemoryThatNothingMaps) {
    const ChildProcess process([] {
        memoryFile(3 * kMiB);
        dup(memoryFile(2 * kMiB));
        const std::string path = "/dev/shm/memweight-held-" + std::to_string(getpid());
        const int file = open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600);
        unlink(path.c_str());
        posix_fallocate(file, 0, kMiB);
        open("/dev/null", O_RDONLY | O_CLOEXEC);
        memfd_create("empty", MFD_CLOEXEC);
        mapAndTouch(memoryFile(5 * kMiB), 5 * kMiB);
        return 0;
    });
    MWLinuxHost host;
    Measured measured(host, {process.pid()});
    const auto objects = measured.objectsOf(0);
    ASSERT_EQ(objects.size(), 3U) << "what the process maps is shown by its regions";
    EXPECT_EQ(objects[0].virtual_size, kMiB);
    EXPECT_EQ(objects[1].virtual_size, 2 * kMiB);
    EXPECT_EQ(objects[2].virtual_size, 3 * kMiB);
    EXPECT_EQ(totalOf(objects), 6 * kMiB);
    EXPECT_EQ(objects[2].purgeState(), VM_PURGABLE_DENY);
    EXPECT_EQ(objects[2].ledgerTag(), MWLedgerDefault);
}

TEST(OwnedObjects, AMappingThatShowsNothingHidesNothing) {
    const ChildProcess process([] {
        mmap(nullptr, kMiB, PROT_READ | PROT_WRITE, MAP_SHARED, memoryFile(kMiB), 0);
        return 0;
    });
    MWLinuxHost host;
    Measured measured(host, {process.pid()});
    EXPECT_EQ(totalOf(measured.objectsOf(0)), kMiB);
}

TEST(OwnedObjects, TheOldestHolderIsChargedUnlessOneOfThemMapsTheObject) {
    const int held = memoryFile(kMiB);
    const int mapped = memoryFile(2 * kMiB);
    const int watched = memoryFile(4 * kMiB);
    const int untouched = memoryFile(8 * kMiB);
    // Whichever is younger by the clock that the kernel tells (hundredths of a second) or, then, by pid.
    const ChildProcess first([&] { return 0; });
    const ChildProcess second([&] {
        mapAndTouch(mapped, 2 * kMiB);
        mmap(nullptr, 8 * kMiB, PROT_READ, MAP_SHARED, untouched, 0);
        return 0;
    });
    const ChildProcess mapper([&] {
        mapAndTouch(watched, 4 * kMiB);
        for (const int file : {held, mapped, watched, untouched}) {
            close(file);
        }
        return 0;
    });
    for (const int file : {held, mapped, watched, untouched}) {
        close(file);
    }
    MWLinuxHost host;
    Measured all(host, {second.pid(), mapper.pid(), first.pid()});
    EXPECT_EQ(totalOf(all.objectsOf(0)), 0U);
    EXPECT_EQ(totalOf(all.objectsOf(1)), 0U);
    const auto charged = all.objectsOf(2);
    EXPECT_EQ(totalOf(charged), 13 * kMiB)
        << "what nobody maps or only one who holds it not, and what a younger one maps and shows nothing of";

    Measured alone(host, {first.pid()});
    EXPECT_EQ(totalOf(alone.objectsOf(0)), 15 * kMiB) << "others are not looked at";
}

TEST(OwnedObjects, ASysVSegmentIsItsCreatorsWhileNobodyHasItAttached) {
    int segment = -1;
    const ChildProcess process([] {
        const int identifier = shmget(IPC_PRIVATE, 3 * kMiB, IPC_CREAT | 0600);
        void* address = shmat(identifier, nullptr, 0);
        std::memset(address, 1, 2 * kMiB);
        shmdt(address);
        return static_cast<uint64_t>(identifier);
    });
    segment = static_cast<int>(process.answer());
    {
        MWLinuxHost host;
        Measured measured(host, {process.pid(), getpid()});
        const auto objects = measured.objectsOf(0);
        ASSERT_EQ(objects.size(), 1U);
        EXPECT_EQ(objects[0].resident, 2 * kMiB);
        EXPECT_EQ(objects[0].virtual_size, 3 * kMiB);
        void* attached = shmat(segment, nullptr, SHM_RDONLY);
        host.beginSurvey();
        EXPECT_TRUE(measured.objectsOf(0).empty());
        shmdt(attached);
    }
    shmctl(segment, IPC_RMID, nullptr);
}

// Two processes hold the sockets: the second is a fork of the first.
TEST(OwnedObjects, SocketBuffersAreOneObjectOfOneProcess) {
    int ends[2][2] = {};
    for (auto& pair : ends) {
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
        const std::string data(50000, 'x');
        ASSERT_EQ(write(pair[0], data.data(), data.size()), 50000);
    }
    const ChildProcess first;
    // A socket stays where it was made.
    const ChildProcess second([] {
        unshare(CLONE_NEWNET);
        return 0;
    });
    for (auto& pair : ends) {
        close(pair[0]);
        close(pair[1]);
    }
    MWLinuxHost host;
    Measured both(host, {first.pid(), second.pid()});
    const auto objects = both.objectsOf(0);
    ASSERT_EQ(objects.size(), 1U);
    EXPECT_EQ(objects[0].ledgerTag(), MWLedgerNetwork);
    EXPECT_GE(objects[0].resident, 100000U);
    EXPECT_TRUE(both.objectsOf(1).empty());
    Measured alone(host, {second.pid()});
    EXPECT_EQ(totalOf(alone.objectsOf(0)), objects[0].resident);
}

TEST(OwnedObjects, AProcessWithoutItsFirstThreadIsLookedAtThroughAnother) {
    const int mapped = memoryFile(2 * kMiB);
    const ChildProcess older;
    const pid_t younger = fork();
    if (younger == 0) {
        std::thread([&] {
            mapAndTouch(mapped, 2 * kMiB);
            pause();
        }).detach();
        syscall(SYS_exit, 0);
    }
    close(mapped);
    const std::string stat = "/proc/" + std::to_string(younger) + "/stat";
    const auto isZombie = [&] {
        std::string text;
        std::getline(std::ifstream(stat), text);
        return text.find(") Z ") != std::string::npos;
    };
    MWLinuxHost host;
    const auto showsMapping = [&] {
        task_t task = 0;
        rusage_info_v5 usage;
        const bool shows = isZombie() && host.task_read_for_pid(younger, task) == KERN_SUCCESS &&
                           host.proc_pid_rusage(younger, usage) == 0 && usage.ri_phys_memweight >= 2 * kMiB;
        host.task_release(task);
        return shows;
    };
    while (!showsMapping()) {
        sched_yield();
    }
    {
        Measured both(host, {older.pid(), younger});
        EXPECT_EQ(totalOf(both.objectsOf(0)), 0U) << "the younger one maps it";
        std::array<ledger_entry_info, 1> ledgers = {};
        size_t filled = 0;
        EXPECT_EQ(host.ledgerEntries(younger, ledgers, filled), 0);
        EXPECT_GT(ledgers[0].lei_balance, 0);
    }
    kill(younger, SIGKILL);
    siginfo_t ended = {};
    waitid(P_PID, static_cast<id_t>(younger), &ended, WEXITED | WNOWAIT);
    rusage_info_v5 usage;
    EXPECT_EQ(host.proc_pid_rusage(younger, usage), -1) << "there is nothing to charge any more";
    waitpid(younger, nullptr, 0);
}

class RecordedDescriptors : public RecordedTree {
protected:
    void writeProcess(const std::string& pid, const std::string& startTime) {
        write(pid + "/stat",
              pid + " (x) S 1 1 1 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 " + startTime + " 0 0 0 1 2 3 0 0\n");
        write(pid + "/maps", "");
        write(pid + "/smaps", "1000-3000 rw-p 00000000 00:00 0\nRss: 8 kB\n");
    }
};

TEST_F(RecordedDescriptors, DevicesAndMapsAreToldByTheirClients) {
    constexpr const char* kClient =
        "drm-driver:\tv3d\ndrm-client-id:\t3\ndrm-total-memory:\t12 MiB\ndrm-purgeable-memory:\t4 KiB\n";
    writeProcess("20", "500");
    link("20/fd/3", "/dev/dri/renderD128");
    link("20/fd/4", "/dev/dri/renderD128");
    link("20/fd/5", "/dev/accel/accel0");
    link("20/fd/6", "anon_inode:bpf-map");
    link("20/fd/7", "/dev/dri/card0");
    link("20/fd/8", "socket:[");
    write("20/fdinfo/3", kClient);
    write("20/fdinfo/4", kClient);
    write("20/fdinfo/5", "drm-driver:\tivpu\ndrm-client-id:\t3\ndrm-resident-memory:\t1 MiB\n");
    write("20/fdinfo/6", "memlock:\t8576\nmap_id:\t17\n");
    // An older process has the same client.
    writeProcess("30", "400");
    link("30/fd/3", "/dev/accel/accel0");
    write("30/fdinfo/3", "drm-driver:\tivpu\ndrm-client-id:\t3\ndrm-resident-memory:\t1 MiB\n");
    MWLinuxHost host(_top);

    Measured alone(host, {20});
    const auto objects = alone.objectsOf(0);
    ASSERT_EQ(objects.size(), 3U);
    EXPECT_EQ(objects[0].resident, 8576U);
    EXPECT_EQ(objects[1].resident, kMiB);
    EXPECT_EQ(objects[1].ledgerTag(), MWLedgerNeural);
    EXPECT_EQ(objects[2].resident, 12 * kMiB) << "two descriptors of one client";
    EXPECT_EQ(objects[2].reusable, 4096U);
    EXPECT_EQ(objects[2].ledgerTag(), MWLedgerGraphics);

    Measured both(host, {20, 30});
    EXPECT_EQ(both.objectsOf(0).size(), 2U);
    EXPECT_EQ(totalOf(both.objectsOf(1)), kMiB);
}

TEST_F(RecordedDescriptors, AProcessThatMayNotBeLookedAtHoldsNothing) {
    writeProcess("20", "500");
    MWLinuxHost host(_top);
    Measured measured(host, {20});
    EXPECT_TRUE(measured.objectsOf(0).empty());
    size_t length = 0;
    EXPECT_LT(host.sysctlOwnedVmObjects(4711, {}, length), 0);
    EXPECT_EQ(errno, ESRCH);
}

}  // namespace

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "cli/CommandLine.h"
#include "cli/MWEntry.h"
#include "platform/linux/MWLinuxHost.h"
#include "support/FakeHost.h"
#include "support/FaultyHost.h"
#include "support/RecordedTree.h"

// Whole runs in which each question to the host in its turn is answered wrongly.

namespace {

using Json = nlohmann::json;

constexpr uint64_t kPage = 4096;

vm_region_submap_info_64 regionOf(uint64_t object, uint8_t shareMode, uint32_t resident, uint32_t dirty) {
    vm_region_submap_info_64 info;
    info.object_id_full = object;
    info.share_mode = shareMode;
    info.pages_resident = resident;
    info.pages_dirtied = dirty;
    return info;
}

FakeRegion mappedFile(uint64_t start, uint64_t object) {
    FakeRegion region = {.start = start, .size = 4 * kPage, .info = regionOf(object, SM_COW, 3, 0)};
    region.info.external_pager = 1;
    region.path = "/usr/share/file";
    return region;
}

// Memory that is looked at page by page: some of it is dirty.
FakeRegion mixedMemory(uint64_t start, uint64_t object) {
    constexpr int32_t kPresent = VM_PAGE_QUERY_PAGE_PRESENT;
    return {.start = start,
            .size = 8 * kPage,
            .info = regionOf(object, SM_SHARED, 4, 2),
            .pages = {kPresent | VM_PAGE_QUERY_PAGE_DIRTY, 0, kPresent | VM_PAGE_QUERY_PAGE_DIRTY,
                      kPresent | VM_PAGE_QUERY_PAGE_EXTERNAL, kPresent | VM_PAGE_QUERY_PAGE_EXTERNAL}};
}

// The shared cache of a 64-bit process, with one image.
constexpr uint64_t kCache = 0x180000000;

FakeProcess process(const std::string& name, uint64_t objects) {
    FakeRegion volatileMemory = {
        .start = 0x30000, .size = 2 * kPage, .info = regionOf(objects + 2, SM_PRIVATE, 2, 2)};
    volatileMemory.purgeState = VM_PURGABLE_VOLATILE;
    FakeRegion cache = {.start = kCache, .size = 16 * kPage, .info = regionOf(1, SM_COW, 0, 0)};
    cache.pages = std::vector<int32_t>(16, VM_PAGE_QUERY_PAGE_PRESENT | VM_PAGE_QUERY_PAGE_DIRTY);
    return {.comm = name.substr(0, 2),
            .executable = "/usr/bin/" + name,
            .regions = {{.start = 0x10000, .size = 4 * kPage, .info = regionOf(objects, SM_PRIVATE, 4, 4)},
                        mappedFile(0x20000, 90),
                        volatileMemory,
                        mixedMemory(0x40000, 91),
                        {.start = 0x60000, .size = 4 * kPage, .info = regionOf(objects + 3, SM_SHARED, 4, 4)},
                        cache},
            .images = {{.path = "/usr/bin/" + name,
                        .baseAddress = 0x20000,
                        .segments = {{"__TEXT", 0x20000, 2 * kPage}}},
                       {.path = "/usr/lib/cached",
                        .baseAddress = kCache,
                        .segments = {{"__DATA", kCache, 4 * kPage}}}},
            .usage = rusage_info_v5{1000 * objects, 2000 * objects},
            .ledgerBalances = {0, 12288},
            .owned = {{.object_id = objects + 3, .virtual_size = 4 * kPage, .resident = 4 * kPage},
                      {.object_id = objects + 4, .virtual_size = 9 * kPage, .resident = 5 * kPage}},
            .ownedError = 0};
}

/// Alpha with its child beta, gamma on its own, delta that nobody is to see, and the kernel.
void setUpSystem(FakeHost& host) {
    host.sharedCache = true;
    host.ledgerNames = {"cpu_time", "page_table"};
    host.processes[0] = {.parent = 0, .comm = "kernel", .flags = PROC_FLAG_SYSTEM | PROC_FLAG_LP64};
    host.processes[10] = process("alpha", 100);
    host.processes[11] = process("beta", 200);
    host.processes[11].parent = 10;
    host.processes[12] = process("gamma", 300);
    host.processes[13] = process("delta", 400);
    host.processes[13].parent = 10;
    host.kernelZones = {{"dentry", {.mzi_count = 3, .mzi_cur_size = 8192, .mzi_elem_size = 192}}};
    mach_memory_info_t site = {};
    site.flags = MWSiteExtension | MWSiteWired;
    site.site = 7;
    site.size = 20480;
    host.kernelRecords = {site};
    host.kernelExtensions = {{7, "net"}};
}

struct Outcome {
    int status = -1;
    std::string messages;  ///< standard error, and the host's own
    std::string report;
    Json document;  ///< null when none was left
    size_t openTasks = 0;
    std::map<HostQuestion, FaultyHost::Form> questions;

    /// What is told of each process.
    std::map<int32_t, Json> processes() const {
        std::map<int32_t, Json> entries;
        for (const Json& entry : document.value("processes", Json::array())) {
            entries[entry["pid"]] = entry;
        }
        return entries;
    }
    std::set<int32_t> pids() const {
        std::set<int32_t> pids;
        for (const auto& [pid, entry] : processes()) {
            pids.insert(pid);
        }
        return pids;
    }
    /// Everything that the run told the user beside figures.
    std::string said() const {
        return document.is_null() ? messages + report
                                  : messages + document["errors"].dump() + document["warnings"].dump();
    }
};

/// Runs the program against the current host; the document goes to `path`.
Outcome runProgram(std::vector<std::string> arguments, const std::string& path) {
    arguments.insert(arguments.begin(), {"-f", "bytes", "-v", "-j", path});
    const CommandLine line(arguments);
    Outcome outcome;
    testing::internal::CaptureStdout();
    testing::internal::CaptureStderr();
    outcome.status = MWMemweightMain(line.argc(), line.argv());
    outcome.report = testing::internal::GetCapturedStdout();
    outcome.messages = testing::internal::GetCapturedStderr();
    std::ifstream file(path);
    outcome.document = file ? Json::parse(file, nullptr, false) : Json();
    return outcome;
}

class Faults : public RecordedTree {
protected:
    Outcome run(const std::vector<std::string>& arguments, const std::optional<HostFault>& fault = {}) {
        FakeHost inner;
        setUpSystem(inner);
        FaultyHost host(inner, fault);
        Outcome outcome = runProgram(arguments, _top + "/report.json");
        host.release();
        if (!inner.unlinked.empty()) {
            outcome.document = Json();
        }
        for (const std::string& error : inner.machErrors) {
            outcome.messages += error + "\n";
        }
        outcome.openTasks = inner.openTasks.size();
        outcome.questions = host.questions();
        return outcome;
    }
};

std::vector<HostFault> faultsOf(const HostQuestion& question, const FaultyHost::Form& form) {
    std::vector<HostFault> faults;
    const auto fails = [&](std::initializer_list<int> codes) {
        for (const int code : codes) {
            faults.push_back({question, FaultKind::fails, code});
        }
    };
    if (form.hasKernelCode) {
        fails({KERN_INVALID_ADDRESS, KERN_INVALID_ARGUMENT, KERN_FAILURE, KERN_RESOURCE_SHORTAGE,
               MACH_SEND_INVALID_DEST});
    }
    if (form.hasErrno) {
        fails({ENOENT, ESRCH, EIO});
    }
    if (form.hasAmount) {
        faults.push_back({question, FaultKind::isHalf});
        faults.push_back({question, FaultKind::isEmpty});
    }
    if (question.pid > 0) {
        faults.push_back({question, FaultKind::processEnds});
    }
    return faults;
}

std::string describe(const HostFault& fault) {
    constexpr const char* kKinds[] = {"fails", "is half", "is empty", "finds the process gone"};
    return fault.question.operation + " " + std::to_string(fault.question.pid) + " #" +
           std::to_string(fault.question.turn) + " " + kKinds[static_cast<size_t>(fault.kind)] + " " +
           std::to_string(fault.code);
}

/// Whether the report may do without this answer and say nothing.
bool isDoneWithout(const HostFault& fault) {
    // Names, paths and images are told as far as they are known, figures beside the tables likewise; memory
    // whose state is not known is not purgeable.
    static const std::set<std::string> kOptional = {
        "sysctlArgumentMaximum",  "sysctlArgumentArea",       "proc_regionfilename",
        "forEachImage",           "proc_pid_rusage",          "proc_get_dirty",
        "loadedKernelExtensions", "mach_vm_purgable_control", "mach_get_times"};
    // A process without a record has ended, and what ends before it is looked at is not reported.
    const bool isRecord = fault.question.operation == "proc_pidinfo";
    // The end of the address space is no failure, nor is a system that has no such control.
    const bool isEnd = fault.question.operation.starts_with("mach_vm_region") &&
                       fault.kind == FaultKind::fails && fault.code == KERN_INVALID_ADDRESS;
    const bool isControl = fault.question.operation == "sysctlOwnedVmObjects" ||
                           fault.question.operation.ends_with("ysctlSelfRegionMemweight");
    const bool isUnknown = isControl && fault.kind == FaultKind::fails && fault.code == ENOENT;
    const bool isShort = fault.kind == FaultKind::isHalf || fault.kind == FaultKind::isEmpty;
    return kOptional.contains(fault.question.operation) || isRecord || isEnd || isUnknown || isShort;
}

/// `spared` are the processes that the fault is none of.
void expectUnharmed(const std::set<int32_t>& spared, const Outcome& outcome, const Outcome& sound) {
    const auto entries = outcome.processes();
    const auto expectedEntries = sound.processes();
    for (const int32_t pid : spared) {
        const Json& expected = expectedEntries.at(pid);
        const auto found = entries.find(pid);
        ASSERT_NE(found, entries.end()) << pid << " is not reported: " << outcome.said();
        // What is shared with the process that failed is in another table, but not in other figures.
        for (const char* member : {"name", "memweight", "regions", "auxiliary", "errors", "warnings"}) {
            EXPECT_EQ(found->second.value(member, Json()), expected.value(member, Json()))
                << pid << " " << member;
        }
    }
}

void expectBorne(const HostFault& fault, const Outcome& outcome, const Outcome& sound) {
    EXPECT_FALSE(outcome.document.is_discarded());
    EXPECT_EQ(outcome.status, outcome.document.is_object() ? 0 : 1);
    EXPECT_EQ(outcome.openTasks, 0U);
    if (outcome.document != sound.document && !isDoneWithout(fault)) {
        EXPECT_NE(outcome.said(), sound.said()) << "another report, and nothing said";
    }
    if (fault.question.pid >= 0) {
        EXPECT_EQ(outcome.status, 0) << outcome.said();
        std::set<int32_t> others = sound.pids();
        others.erase(fault.question.pid);
        expectUnharmed(others, outcome, sound);
    }
}

TEST_F(Faults, EveryQuestionInItsTurn) {
    const std::vector<std::vector<std::string>> commandLines = {
        {"-t", "-x", "delta", "--pid", "10", "gamma", "kernel"},
        {"-a"},
        {"--unmapped", "alpha", "gamma"},
    };
    for (const auto& arguments : commandLines) {
        const Outcome sound = run(arguments);
        ASSERT_EQ(sound.status, 0) << sound.messages;
        ASSERT_EQ(sound.messages, "");
        ASSERT_GE(sound.processes().size(), 2U);
        for (const auto& [question, form] : sound.questions) {
            for (const HostFault& fault : faultsOf(question, form)) {
                SCOPED_TRACE(arguments.front() + ": " + describe(fault));
                expectBorne(fault, run(arguments, fault), sound);
            }
        }
    }
}

// The system may never answer, about one process: that one is an error, and the others are what they are.
TEST_F(Faults, AProcessThatDoesNotRespond) {
    const Outcome sound = run({"-a"});
    std::set<std::string> operations;
    for (const auto& [question, form] : sound.questions) {
        // Of the list of processes and of the run's own surroundings there is no going on without an answer.
        if (question.pid < 0 || question.turn != 1) {
            continue;
        }
        SCOPED_TRACE(question.operation + " " + std::to_string(question.pid));
        operations.insert(question.operation);
        const Outcome outcome = run({"-a"}, HostFault{question, FaultKind::hangs});
        EXPECT_EQ(outcome.status, 0);
        EXPECT_EQ(outcome.openTasks, 0U);
        auto spared = sound.pids();
        spared.erase(question.pid);
        expectUnharmed(spared, outcome, sound);
        const Json stuck = outcome.processes().at(question.pid);
        ASSERT_EQ(stuck["errors"].size(), 1U);
        // One that could not even be made has the name of the list.
        const std::string text = stuck["errors"][0];
        EXPECT_EQ(text, stuck["name"].get<std::string>() + " [" + std::to_string(question.pid) +
                            "]: not responding");
        EXPECT_NE(outcome.report.find(text), std::string::npos) << outcome.report;
    }
    EXPECT_GE(operations.size(), 14U) << "the questions of a whole gathering";
}

/// A procfs of three processes, each of a text, a heap that it shares with its family in part, shared memory
/// and a stack. Their pids are beyond the largest one: nothing is asked about a real process.
class FaultyFiles : public RecordedTree {
protected:
    static constexpr int32_t kFirst = 5000001;
    static constexpr int32_t kLast = 5000003;

    void SetUp() override {
        RecordedTree::SetUp();
        for (int32_t pid = kFirst; pid <= kLast; ++pid) {
            writeProcess(std::to_string(pid));
        }
        writeKernel();
    }

    void writeProcess(const std::string& pid) {
        const std::string folder = "proc/" + pid + "/";
        const std::string stat =
            pid + " (server) S 1 1 1 0 -1 0 0 0 0 0 0 0 0 0 20 0 1 0 500 0 0 0 1 2 3 0 0\n";
        write(folder + "stat", stat);
        write(folder + "task/" + pid + "/stat", stat);
        write(folder + "status", "VmHWM:\t  60 kB\nRssAnon:\t  20 kB\nRssShmem:\t  16 kB\nVmPTE:\t  12 kB\n");
        write(folder + "cmdline", std::string("/usr/bin/server-") + pid.back() + '\0');
        // AT_RANDOM alone, and the end.
        write(folder + "auxv",
              std::string("\x19\0\0\0\0\0\0\0\x09\x34\x56\x7f\xfe\x7f\0\0", 16) + std::string(16, '\0'));
        write(folder + "maps", "");
        write(
            folder + "smaps",
            "10000-14000 r-xp 00000000 fe:00 77 /usr/bin/server\nRss: 16 kB\nPss: 8 kB\nShared_Clean: 16 kB\n"
            "VmFlags: rd ex mr mw me\n"
            "20000-28000 rw-p 00000000 00:00 0 [heap]\nRss: 16 kB\nPss: 12 kB\nShared_Dirty: 8 kB\n"
            "Private_Dirty: 8 kB\nAnonymous: 16 kB\nVmFlags: rd wr mr mw me ac\n"
            "30000-38000 rw-s 00000000 00:01 99 /memfd:pool (deleted)\nRss: 16 kB\nPss: 8 kB\n"
            "Shared_Dirty: 16 kB\nVmFlags: rd wr sh mr mw me ms\n"
            "40000-42000 rw-p 00000000 00:00 0 [stack]\nRss: 4 kB\nPss: 4 kB\nPrivate_Dirty: 4 kB\n"
            "Anonymous: 4 kB\nVmFlags: rd wr mr mw me gd ac\n");
        write(folder + "pagemap", pagemap());
        write(folder + "fdinfo/3", "map_type:\t1\nmemlock:\t4096\nmap_id:\t1" + pid + "\n");
        link(folder + "fd/3", "anon_inode:bpf-map");
        link(folder + "exe", ("/usr/bin/server-" + pid).c_str());
        link(folder + "root", "/");
        link(folder + "ns/mnt", "mnt:[4026531841]");
        link(folder + "ns/ipc", "ipc:[4026531839]");
        link(folder + "ns/net", "net:[4026531840]");
        write(folder + "mountinfo", "24 23 0:34 / /dev/shm rw - tmpfs tmpfs rw\n");
    }

    /// The first four pages of each mapping, half of the heap's its own.
    static std::string pagemap() {
        constexpr uint64_t kPresent = uint64_t{1} << 63U;
        constexpr uint64_t kFileOrShared = uint64_t{1} << 61U;
        constexpr uint64_t kExclusive = uint64_t{1} << 56U;
        std::vector<uint64_t> entries(0x42);
        for (size_t page = 0; page < 4; ++page) {
            entries[0x10 + page] = entries[0x30 + page] = kPresent | kFileOrShared;
            entries[0x20 + page] = page < 2 ? kPresent : kPresent | kExclusive;
        }
        entries[0x41] = kPresent | kExclusive;
        return {reinterpret_cast<const char*>(entries.data()), entries.size() * sizeof(uint64_t)};
    }

    void writeKernel() {
        write("proc/sys/kernel/random/boot_id", "a4b9c1f2-0000-4000-8000-000000000000\n");
        write("proc/meminfo",
              "MemTotal: 100000 kB\nMemFree: 40000 kB\nActive: 20000 kB\nInactive: 10000 kB\nSlab: 800 kB\n"
              "SReclaimable: 300 kB\nSUnreclaim: 500 kB\nKernelStack: 160 kB\nPageTables: 200 kB\n"
              "VmallocUsed: 600 kB\nPercpu: 70 kB\n");
        write("proc/vmstat", "nr_zspages 1\nnr_memmap_pages 2\n");
        write("proc/zoneinfo", "Node 0, zone DMA\n  pagesets\n    cpu: 0\n              count:    9\n");
        write("proc/slabinfo",
              "slabinfo - version: 2.1\n"
              "dentry 900 1000 192 21 1 : tunables 0 0 0 : slabdata 50 50 0\n"
              "kmalloc-64 50 64 64 64 1 : tunables 0 0 0 : slabdata 2 2 0\n");
        write("proc/vmallocinfo",
              "0x0-0x0 20480 kernel_clone+0x94/0x3e0 pages=30 vmalloc N0=30\n"
              "0x0-0x0 20480 make_table+0x10/0x20 [net] pages=5 vmalloc N0=5\n");
        write("proc/modules", "net 61440 2 fs, Live 0x0000000000000000\n");
        write("proc/sysvipc/shm",
              "key shmid perms size cpid lpid nattch uid gid cuid cgid atime dtime ctime rss swap\n"
              "0 7 1600 4096 5000001 0 0 0 0 0 0 0 0 4000000000 4096 0\n");
        write("sys/kernel/slab/kmalloc-64/reclaim_account", "0\n");
    }

    Outcome measure() {
        MWLinuxHost host(_top + "/proc", _top + "/sys");
        MWHostInterface* const previous = MWHostInterface::setCurrent(&host);
        Outcome outcome = runProgram({"--pid", "5000001", "--pid", "5000002", "--pid", "5000003", "kernel"},
                                     _top + "/report.json");
        MWHostInterface::setCurrent(previous);
        for (Json& process : outcome.document["processes"]) {
            for (Json& region : process["regions"]) {
                region.erase("id");  // made of the machine's boot, which is a file, too
            }
        }
        return outcome;
    }

    /// Everything in the tree, relative to its top.
    std::vector<std::string> names() const {
        std::vector<std::string> names;
        for (const char* part : {"proc", "sys"}) {
            for (const auto& entry : std::filesystem::recursive_directory_iterator(_top + "/" + part)) {
                names.push_back(entry.path().lexically_relative(_top));
            }
        }
        std::ranges::sort(names);
        return names;
    }

    /// The processes that this file tells nothing of.
    static std::set<int32_t> sparedBy(const std::string& name, std::set<int32_t> pids) {
        const std::filesystem::path path = name;
        const std::string folder = *std::next(path.begin());
        if (folder == "sysvipc") {
            pids.erase(kFirst);  // which has made the segment
        } else if (folder.find_first_not_of("0123456789") == std::string::npos) {
            pids.erase(std::stoi(folder));
            // The kernel is not charged for the page tables that are told here.
            pids.erase(path.filename() == "status" || path.filename() == folder ? 0 : -1);
        } else if (!name.starts_with("proc/sys")) {
            pids.erase(0);
        }
        return pids;
    }

    /// Files without which a process cannot be measured; `maps` is not read of one as small as these.
    static bool isNeeded(const std::filesystem::path& name) {
        static const std::set<std::string> kNeeded = {"stat", "smaps", "pagemap"};
        const bool isOfProcess = std::distance(name.begin(), name.end()) == 3;
        return isOfProcess && kNeeded.contains(name.filename());
    }

    void expectBorneWithout(const std::string& name, const Outcome& sound, const char* how) {
        SCOPED_TRACE(name + " " + how);
        const Outcome outcome = measure();
        EXPECT_EQ(outcome.status, 0);
        EXPECT_TRUE(outcome.document.is_object());
        expectUnharmed(sparedBy(name, sound.pids()), outcome, sound);
        if (isNeeded(name) && how == std::string("missing")) {
            EXPECT_NE(outcome.said(), sound.said());
        }
    }
};

TEST_F(FaultyFiles, EachInItsTurn) {
    const Outcome sound = measure();
    ASSERT_EQ(sound.pids(), (std::set{0, kFirst, kFirst + 1, kLast}));
    ASSERT_EQ(sound.said(), "[][]");
    for (const std::string& name : names()) {
        const std::filesystem::path path = place(name);
        const std::string aside = _top + "/aside";
        if (!std::filesystem::is_symlink(path) && std::filesystem::is_regular_file(path)) {
            const auto size = std::filesystem::file_size(path);
            std::filesystem::copy_file(path, aside);
            std::filesystem::resize_file(path, size / 2);
            expectBorneWithout(name, sound, "cut");
            std::filesystem::resize_file(path, 0);
            expectBorneWithout(name, sound, "empty");
            std::filesystem::rename(aside, path);
        }
        std::filesystem::rename(path, aside);
        expectBorneWithout(name, sound, "missing");
        std::filesystem::rename(aside, path);
    }
    EXPECT_EQ(measure().processes(), sound.processes()) << "each was put back";
}

}  // namespace

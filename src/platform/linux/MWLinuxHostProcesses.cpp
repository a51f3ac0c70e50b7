#include <fcntl.h>
#include <unistd.h>

#include <elf.h>
#include <algorithm>
#include <array>
#include <cerrno>
#include <utility>

#include "platform/linux/MWLinuxHost.h"

// The questions about processes as such: the list, their records, names and the kernel's own figures.

namespace {

constexpr uint32_t kRunning = 2;

template <size_t N>
void copyText(std::array<char, N>& to, std::string_view from) {
    std::copy_n(from.begin(), std::min(from.size(), N), to.begin());
}

// A directory entry that has gone, and a text that cannot be read any more, both mean that the process has.
int noSuchProcess() {
    errno = ESRCH;
    return -1;
}

// A process lives as long as one of its threads does; the first one can end before the others.
uint32_t statusOf(const procfs::ProcStat& stat, int directory) {
    return stat.threadEnded() && !hasLiveThread(directory) ? SZOMB : kRunning;
}

// The kernel itself, as pid 0.
proc_bsdinfo kernelRecord() {
    proc_bsdinfo record = {};
    record.pbi_flags = PROC_FLAG_SYSTEM | PROC_FLAG_LP64;
    record.pbi_status = kRunning;
    copyText(record.pbi_comm, "kernel");
    copyText(record.pbi_name, "kernel");
    return record;
}

// Since boot rather than since 1970: exact, whatever is done to the wall clock.
void setStartTime(proc_bsdinfo& record, uint64_t ticks) {
    constexpr uint64_t kMicroseconds = 1'000'000;
    const auto perSecond = static_cast<uint64_t>(sysconf(_SC_CLK_TCK));
    record.pbi_start_tvsec = ticks / perSecond;
    record.pbi_start_tvusec = ticks % perSecond * kMicroseconds / perSecond;
}

// The path of the executable, which keeps its name where it was replaced while it ran, without the mark that
// the kernel adds. Empty with errno where it is hidden.
std::string executableOf(int directory) {
    constexpr std::string_view kDeleted = " (deleted)";
    std::string path;
    procfs::readLink(directory, "exe", path);
    return path.ends_with(kDeleted) ? path.substr(0, path.size() - kDeleted.size()) : path;
}

// The program's file name. To read the command line is to read the process's memory, which waits for whoever
// has locked its memory map; so that is asked for only where the executable is hidden.
std::string programName(int directory, const std::string& executable) {
    std::string commandLine;
    if (executable.empty()) {
        procfs::readRecord(directory, "cmdline", commandLine);
        return procfs::nameFromCommandLine(commandLine);
    }
    return executable.substr(executable.rfind('/') + 1);
}

// The class byte of the executable.
bool executableIs64bit(int directory) {
    std::string header;
    procfs::readFile(directory, "exe", header, EI_NIDENT);
    return header.size() <= EI_CLASS || header[EI_CLASS] != ELFCLASS32;
}

uint64_t physicalCharge(const procfs::ProcStatus& status) {
    return status.rssAnon + status.rssShmem + status.vmSwap + status.vmPte + status.hugetlbPages;
}

std::vector<int32_t> numericEntries(int procDirectory) {
    std::vector<int32_t> pids;
    procfs::forEachEntry(procDirectory, ".", [&](int, std::string_view name) {
        int32_t pid = 0;
        if (procfs::takeNumber(name, pid) && name.empty()) {
            pids.push_back(pid);
        }
        return true;
    });
    std::sort(pids.begin(), pids.end());
    return pids;
}

// The kernel enlarges the table of a program's descriptors when one does not fit. Once there are threads it
// then waits until no processor can be looking at the old table any more, which takes as long as to measure a
// hundred processes; so it is enlarged before, to hold a descriptor for each process.
void makeRoomForDescriptors(size_t processes) {
    constexpr size_t kOthers = 64;
    const int last = fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, static_cast<int>(processes + kOthers));
    procfs::Descriptor(last).reset();
}

}  // namespace

int MWLinuxHost::_processDirectory(int32_t pid, procfs::Descriptor& opened) {
    if (const LinuxTask* task = _taskOfPid(pid)) {
        return task->directory();
    }
    opened = procfs::open(_run.proc.get(), std::to_string(pid).c_str(), O_PATH | O_DIRECTORY);
    return opened.get();
}

bool MWLinuxHost::_readProcessFile(int32_t pid, const char* name, std::string& text) {
    procfs::Descriptor opened;
    const int directory = _processDirectory(pid, opened);
    const bool read = directory >= 0 && procfs::readRecord(directory, name, text);
    if (!read && (errno == ENOENT || errno == EBADF)) {
        errno = ESRCH;
    }
    return read;
}

// Of a thread that lives: the first one can end before the others.
std::optional<procfs::ProcStatus> MWLinuxHost::_memoryStatusOfPid(int32_t pid) {
    if (LinuxTask* task = _taskOfPid(pid)) {
        return task->status();
    }
    std::string text;
    return _readProcessFile(pid, "status", text) ? std::optional(procfs::parseStatus(text)) : std::nullopt;
}

std::optional<procfs::ProcStat> MWLinuxHost::_statOfPid(int32_t pid) {
    std::string text;
    return _readProcessFile(pid, "stat", text) ? procfs::parseStat(text) : std::nullopt;
}

int MWLinuxHost::proc_listallpids(std::span<int32_t> pids) {
    if (pids.empty()) {
        _forgetListed();
    }
    // Whoever asks for the number asks for the pids next.
    const std::lock_guard lock(_listedMutex);
    const std::vector<int32_t> entries =
        _listedPids.empty() ? numericEntries(_run.proc.get()) : std::exchange(_listedPids, {});
    if (entries.empty()) {
        return -1;
    }
    makeRoomForDescriptors(entries.size());
    if (pids.empty()) {
        _listedPids = entries;
        return static_cast<int>(entries.size() + 1);
    }
    pids[0] = 0;
    const size_t filled = 1 + std::min(entries.size(), pids.size() - 1);
    std::copy_n(entries.begin(), filled - 1, pids.begin() + 1);
    return static_cast<int>(filled);
}

int MWLinuxHost::proc_pidinfo(int32_t pid, proc_bsdshortinfo& record) {
    const auto stat = _statOfPid(pid);
    if (!stat) {
        return noSuchProcess();
    }
    record = {};
    record.pbsi_pid = static_cast<uint32_t>(pid);
    record.pbsi_ppid = static_cast<uint32_t>(stat->ppid);
    procfs::Descriptor opened;
    record.pbsi_status = statusOf(*stat, _processDirectory(pid, opened));
    copyText(record.pbsi_comm, stat->comm);
    return sizeof(record);
}

int MWLinuxHost::proc_pidinfo(int32_t pid, proc_bsdinfo& record) {
    if (pid == 0) {
        record = kernelRecord();
        return sizeof(record);
    }
    procfs::Descriptor opened;
    const int directory = _processDirectory(pid, opened);
    std::string text;
    const auto stat = directory >= 0 && procfs::readRecord(directory, "stat", text) ? procfs::parseStat(text)
                                                                                    : std::nullopt;
    if (!stat || stat->isKernelThread()) {
        return noSuchProcess();
    }
    record = {};
    record.pbi_pid = static_cast<uint32_t>(pid);
    record.pbi_ppid = static_cast<uint32_t>(stat->ppid);
    record.pbi_status = statusOf(*stat, directory);
    setStartTime(record, stat->startTime);
    copyText(record.pbi_comm, stat->comm);
    ListedProcess listed;
    listed.executable = executableOf(directory);
    copyText(record.pbi_name, programName(directory, listed.executable));
    listed.directory = std::move(opened);
    listed.stat = *stat;
    procfs::readRecord(directory, "auxv", listed.auxv);
    const std::optional<bool> is64bit = procfs::auxvIs64bit(listed.auxv);
    record.pbi_flags = (is64bit ? *is64bit : executableIs64bit(directory)) ? PROC_FLAG_LP64 : 0;
    if (listed.directory) {
        const std::lock_guard lock(_listedMutex);
        _listed.insert_or_assign(pid, std::move(listed));
    }
    return sizeof(record);
}

int MWLinuxHost::proc_pid_rusage(int32_t pid, rusage_info_v5& record) {
    const auto status = _memoryStatusOfPid(pid);
    if (!status || !status->hasMemory) {
        return noSuchProcess();
    }
    record.ri_phys_memweight = physicalCharge(*status);
    record.ri_lifetime_max_phys_memweight = std::max(record.ri_phys_memweight, status->vmHwm);
    return 0;
}

int MWLinuxHost::proc_get_dirty(int32_t, uint32_t& flags) {
    flags = 0;
    return 0;
}

int MWLinuxHost::sysctlArgumentMaximum(uint64_t& bytes) {
    static const long maximum = sysconf(_SC_ARG_MAX);
    bytes = static_cast<uint64_t>(std::max(maximum, 0L));
    return maximum > 0 ? 0 : -1;
}

// Of a process that was listed a moment ago it is the one that it had then.
std::string MWLinuxHost::_executableOfPid(int32_t pid) {
    if (const LinuxTask* task = _taskOfPid(pid); task != nullptr && !task->executable().empty()) {
        return task->executable();
    }
    {
        const std::lock_guard lock(_listedMutex);
        const auto listed = _listed.find(pid);
        if (listed != _listed.end() && !listed->second.executable.empty()) {
            return listed->second.executable;
        }
    }
    procfs::Descriptor opened;
    const int directory = _processDirectory(pid, opened);
    return directory < 0 ? std::string() : executableOf(directory);
}

// Without the arguments: nobody asks for them, and see programName.
int MWLinuxHost::sysctlArgumentArea(int32_t pid, std::span<char> area, size_t& length) {
    const std::string path = _executableOfPid(pid);
    if (path.empty()) {
        return -1;
    }
    std::string bytes(sizeof(int32_t), '\0');
    bytes.append(path).append(1, '\0');
    length = std::min(area.size(), bytes.size());
    std::copy_n(bytes.begin(), length, area.begin());
    return 0;
}

int MWLinuxHost::ledgerTemplate(std::span<ledger_template_info> records, size_t& filled) {
    filled = 0;
    if (!records.empty()) {
        records.front() = {};
        copyText(records.front().lti_name, "page_table");
        copyText(records.front().lti_group, "physmem");
        copyText(records.front().lti_units, "bytes");
        filled = 1;
    }
    return 0;
}

// Page tables belong to an address space: of processes that share one, only its owner is charged for them.
int MWLinuxHost::ledgerEntries(int32_t pid, std::span<ledger_entry_info> records, size_t& filled) {
    filled = 0;
    const auto status = _memoryStatusOfPid(pid);
    if (!status) {
        return noSuchProcess();
    }
    if (!records.empty()) {
        LinuxTask* task = _taskOfPid(pid);
        const bool isCharged = task == nullptr || !task->sharesAnothersSpace();
        records.front() = {};
        records.front().lei_balance = isCharged ? static_cast<int64_t>(status->vmPte) : 0;
        filled = 1;
    }
    return 0;
}

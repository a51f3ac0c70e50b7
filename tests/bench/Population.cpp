#include "bench/Population.h"

#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string_view>

namespace {

constexpr size_t kPage = 4096;
constexpr std::string_view kWorker = "--worker";

void require(bool condition, const char* what) {
    if (!condition) {
        std::perror(what);
        std::_Exit(1);
    }
}

void dieWithParent(pid_t parent) {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    if (getppid() != parent) {
        std::_Exit(1);
    }
}

char* mapAnonymous(size_t bytes) {
    void* memory = mmap(nullptr, bytes, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0);
    require(memory != MAP_FAILED, "mmap");
    return static_cast<char*>(memory);
}

// Neighbours of different protection stay mappings of their own.
void makeMappings(size_t mappings, size_t bytes) {
    const size_t each = bytes / mappings / kPage * kPage;
    char* memory = mapAnonymous(each * mappings);
    for (size_t index = 0; index < mappings; ++index) {
        std::memset(memory + index * each, 1, each);
        if (index % 2 != 0) {
            require(mprotect(memory + index * each, each, PROT_READ) == 0, "mprotect");
        }
    }
}

void makeFamily(size_t children, size_t bytes) {
    std::memset(mapAnonymous(bytes), 1, bytes);
    const pid_t parent = getpid();
    for (size_t child = 0; child < children; ++child) {
        const pid_t pid = fork();
        require(pid >= 0, "fork");
        if (pid == 0) {
            dieWithParent(parent);
            return;
        }
    }
}

void report() {
    const pid_t pid = getpid();
    require(write(STDOUT_FILENO, &pid, sizeof(pid)) == sizeof(pid), "report");
    close(STDOUT_FILENO);
}

}  // namespace

void runAsWorker(int argc, char* argv[]) {
    if (argc < 6 || argv[1] != kWorker) {
        return;
    }
    dieWithParent(std::atoi(argv[5]));
    const size_t number = std::strtoull(argv[3], nullptr, 10);
    const size_t bytes = std::strtoull(argv[4], nullptr, 10);
    if (std::string_view(argv[2]) == "family") {
        makeFamily(number, bytes);
    } else {
        makeMappings(number, bytes);
    }
    report();
    while (true) {
        pause();
    }
}

Population Population::ofProcesses(size_t count, size_t mappings, size_t bytes) {
    Population population;
    for (size_t index = 0; index < count; ++index) {
        population._add({"mappings", std::to_string(mappings), std::to_string(bytes)}, 1);
    }
    return population;
}

Population Population::ofFamily(size_t children, size_t bytes) {
    Population population;
    population._add({"family", std::to_string(children), std::to_string(bytes)}, children + 1);
    return population;
}

void Population::_add(const std::vector<std::string>& arguments, size_t processes) {
    std::array<int, 2> ends = {};
    require(pipe(ends.data()) == 0, "pipe");
    const std::string parent = std::to_string(getpid());
    const pid_t worker = fork();
    require(worker >= 0, "fork");
    if (worker == 0) {
        setpgid(0, 0);
        dup2(ends[1], STDOUT_FILENO);
        close(ends[0]);
        close(ends[1]);
        execl("/proc/self/exe", "worker", kWorker.data(), arguments[0].c_str(), arguments[1].c_str(),
              arguments[2].c_str(), parent.c_str(), nullptr);
        std::_Exit(1);
    }
    close(ends[1]);
    _workers.push_back(worker);
    for (size_t index = 0; index < processes; ++index) {
        pid_t pid = 0;
        require(read(ends[0], &pid, sizeof(pid)) == sizeof(pid), "a process did not start");
        _pids.push_back(pid);
    }
    close(ends[0]);
}

Population::~Population() {
    for (const pid_t worker : _workers) {
        kill(-worker, SIGKILL);
        kill(worker, SIGKILL);
        waitpid(worker, nullptr, 0);
    }
}

MappingProcess::MappingProcess(size_t bytes)
    : _slowest(new (mmap(nullptr, kPage, PROT_READ | PROT_WRITE, MAP_SHARED | MAP_ANONYMOUS, -1, 0))
                   std::atomic<uint64_t>(UINT64_MAX)) {
    const pid_t parent = getpid();
    _pid = fork();
    require(_pid >= 0, "fork");
    if (_pid == 0) {
        dieWithParent(parent);
        std::memset(mapAnonymous(bytes), 1, bytes);
        *_slowest = 0;
        while (true) {
            const auto begin = std::chrono::steady_clock::now();
            char* page = mapAnonymous(kPage);
            *page = 1;
            munmap(page, kPage);
            const auto taken = static_cast<uint64_t>((std::chrono::steady_clock::now() - begin).count());
            if (taken > *_slowest) {
                *_slowest = taken;
            }
        }
    }
    while (*_slowest == UINT64_MAX) {
        usleep(1000);
    }
}

MappingProcess::~MappingProcess() {
    kill(_pid, SIGKILL);
    waitpid(_pid, nullptr, 0);
    munmap(_slowest, kPage);
}

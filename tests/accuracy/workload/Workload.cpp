// Processes with a known history of their memory, for measuring: "SCENARIO NUMBER...", one argument. Sizes
// are MiB. Each process is reported on standard output as "NAME PID" when its memory is as the scenario wants
// it, then waits to be killed; "ready" comes last. A program of its own, so that nothing but the scenario (no
// test framework, no sanitizer) is in its memory.

#include <fcntl.h>
#include <sched.h>
#include <sys/mman.h>
#include <sys/prctl.h>
#include <sys/shm.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iterator>
#include <map>
#include <random>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

namespace {

constexpr size_t kMiB = size_t{1} << 20U;
constexpr size_t kPage = 4096;

int reportPipe = -1;  ///< to the process that waits in `spawn` for this one

void require(bool condition, const char* what) {
    if (!condition) {
        perror(what);
        kill(0, SIGKILL);  // the whole group, or the test would wait for the rest of it
    }
}

// Standard input ends when the test does, however it ends.
[[noreturn]] void waitForEnd() {
    char byte = 0;
    while (read(STDIN_FILENO, &byte, 1) > 0) {
    }
    _exit(0);
}

void say(const std::string& line) {
    require(write(STDOUT_FILENO, line.data(), line.size()) == static_cast<ssize_t>(line.size()), "report");
}

void reportAs(const std::string& name, pid_t pid = getpid()) {
    say(name + " " + std::to_string(pid) + "\n");
}

/// Forks a process that does `work` and stays; returns when the work is done.
void spawn(const std::string& name, const std::function<void()>& work) {
    std::array<int, 2> done = {};
    require(pipe(done.data()) == 0, "pipe");
    const pid_t pid = fork();
    require(pid >= 0, "fork");
    if (pid == 0) {
        close(done[0]);
        close(reportPipe);  // whoever waits for the parent must see the parent's end
        reportPipe = done[1];
        work();
        reportAs(name);
        require(write(reportPipe, "", 1) == 1, "write");
        waitForEnd();
    }
    close(done[1]);
    char byte = 0;
    require(read(done[0], &byte, 1) == 1, "a spawned process");
    close(done[0]);
}

/// Forks a process that does `work` and ends; returns when it has ended.
void spawnAndEnd(const std::function<void()>& work) {
    const pid_t pid = fork();
    require(pid >= 0, "fork");
    if (pid == 0) {
        work();
        _exit(0);
    }
    int status = 0;
    require(waitpid(pid, &status, 0) == pid && status == 0, "a process that ends");
}

struct Mapping {
    int flags = MAP_PRIVATE | MAP_ANONYMOUS;
    int file = -1;
    size_t offset = 0;
};

char* map(size_t size, Mapping mapping = {}) {
    void* start = mmap(nullptr, size, PROT_READ | PROT_WRITE, mapping.flags, mapping.file,
                       static_cast<off_t>(mapping.offset));
    require(start != MAP_FAILED, "mmap");
    return static_cast<char*>(start);
}

void touch(char* start, size_t size) {
    static std::minstd_rand random;
    for (size_t offset = 0; offset < size; offset += kPage) {
        // The compiler must not know that the page is rewritten with what it had.
        *reinterpret_cast<volatile uint64_t*>(start + offset) = random();
    }
}

char* mapTouched(size_t size) {
    char* start = map(size);
    touch(start, size);
    return start;
}

void readPages(const char* start, size_t size) {
    for (size_t offset = 0; offset < size; offset += kPage) {
        static_cast<void>(*static_cast<const volatile char*>(start + offset));
    }
}

/// The words behind the scenario's name.
class Arguments {
public:
    explicit Arguments(std::istream& words) : _words(std::istream_iterator<std::string>(words), {}) {}
    size_t count(size_t index) const { return std::stoul(_words.at(index)); }
    size_t size(size_t index) const { return count(index) * kMiB; }
    const char* text(size_t index) const { return _words.at(index).c_str(); }

private:
    std::vector<std::string> _words;
};

std::string numbered(const char* name, size_t number) {
    return name + std::to_string(number);
}

// TOUCHED CHILDREN REWRITTEN LATER: the children each rewrite a range of their own. The first has a child
// from before its rewriting; with LATER, the same first child then rewrites that much more and forks three
// times.
void forkTree(const Arguments& arguments) {
    const size_t children = arguments.count(1);
    const size_t rewritten = arguments.size(2);
    const size_t later = arguments.size(3);
    char* memory = mapTouched(arguments.size(0));
    for (size_t child = 0; child < children; ++child) {
        spawn(numbered("child", child), [=] {
            if (child == 0) {
                spawn("grandchild", [=] { touch(memory + children * rewritten, rewritten); });
            }
            touch(memory + child * rewritten, rewritten);
            if (child == 0 && later != 0) {
                touch(memory, later);
                for (size_t generation = 0; generation < 3; ++generation) {
                    spawn(numbered("generation", generation), [] {});
                }
            }
        });
    }
}

/// One page of every `step` bytes.
void touchEvery(size_t step, char* start, size_t size) {
    for (size_t page = 0; page < size; page += step) {
        touch(start + page, kPage);
    }
}

// PROCESSES SIZE FILE SHMFILE: each kind of memory that is shared by mapping it, SIZE of each kind, of which
// each process sees and touches other parts.
void sharedObjects(const Arguments& arguments) {
    const size_t processes = arguments.count(0);
    const size_t size = arguments.size(1);
    const size_t step = size / (processes + 1) / kPage * kPage;
    constexpr int kNew = O_RDWR | O_CREAT | O_CLOEXEC;
    const std::array<int, 3> files = {memfd_create("shared", MFD_CLOEXEC),
                                      open(arguments.text(2), kNew, 0600),
                                      open(arguments.text(3), kNew, 0600)};
    for (const int file : files) {
        require(ftruncate(file, static_cast<off_t>(size)) == 0, "a file to share");
    }
    const int segment = shmget(IPC_PRIVATE, size, IPC_CREAT | 0600);
    char* attached = static_cast<char*>(shmat(segment, nullptr, 0));
    // Removed with its last user.
    require(shmctl(segment, IPC_RMID, nullptr) == 0, "shmget");
    char* anonymous = map(size, {.flags = MAP_SHARED | MAP_ANONYMOUS});
    for (size_t process = 0; process < processes; ++process) {
        spawn(numbered("process", process), [=] {
            const size_t offset = process * step;
            for (const int file : files) {
                const Mapping part = {.flags = MAP_SHARED, .file = file, .offset = offset};
                touch(map(2 * step, part), 2 * step);
                // Again at another place, untouched but for one page in three.
                touchEvery(3 * kPage, map(2 * step, part), 2 * step);
            }
            touch(attached + offset, 2 * step);
            touchEvery(processes * 2 * kPage, anonymous + process * kPage, size - process * kPage);
        });
    }
}

// KIND SIZE: one process with so much of each kind.
void pageKinds(const Arguments& arguments) {
    const size_t size = arguments.size(0);
    mapTouched(size);
    require(madvise(mapTouched(size), size / 2, MADV_FREE) == 0, "MADV_FREE");
    require(mlock(mapTouched(size), size) == 0, "mlock");
    // Half of it comes back from swap.
    char* swapped = mapTouched(size);
    require(madvise(swapped, size, MADV_PAGEOUT) == 0, "MADV_PAGEOUT");
    readPages(swapped, size / 2);
    touch(map(size, {.flags = MAP_PRIVATE | MAP_ANONYMOUS | MAP_HUGETLB}), size);
    char* transparent = map(size);
    madvise(transparent, size, MADV_HUGEPAGE);
    touch(transparent, size);
    readPages(map(size), size);  // the zero page
}

// FILE PROCESSES: each maps all of the file privately, reads it and writes a tenth; with no processes this
// one does.
void privateFile(const Arguments& arguments) {
    const int file = open(arguments.text(0), O_RDONLY | O_CLOEXEC);
    const auto size = static_cast<size_t>(lseek(file, 0, SEEK_END));
    const auto mapAndWrite = [=](size_t process) {
        char* memory = map(size, {.flags = MAP_PRIVATE, .file = file});
        readPages(memory, size);
        touch(memory + process * (size / 10 / kPage * kPage), size / 10);
    };
    for (size_t process = 0; process < arguments.count(1); ++process) {
        spawn(numbered("process", process), [=] { mapAndWrite(process); });
    }
    if (arguments.count(1) == 0) {
        mapAndWrite(1);
    }
}

// SIZE: just so much memory.
void plain(const Arguments& arguments) {
    mapTouched(arguments.size(0));
}

// SIZE CHILDREN: swapped out, then forked.
void swappedThenForked(const Arguments& arguments) {
    char* memory = mapTouched(arguments.size(0));
    require(madvise(memory, arguments.size(0), MADV_PAGEOUT) == 0, "MADV_PAGEOUT");
    for (size_t child = 0; child < arguments.count(1); ++child) {
        spawn(numbered("child", child), [] {});
    }
}

// SIZE CHILDREN: each touches the same addresses for itself, then the parent becomes another program.
void orphansOfExec(const Arguments& arguments) {
    const size_t size = arguments.size(0);
    char* memory = map(size);
    for (size_t child = 0; child < arguments.count(1); ++child) {
        spawn(numbered("child", child), [=] { touch(memory, size); });
    }
    execl("/proc/self/exe", "workload", "plain 1", nullptr);
    require(false, "exec");
}

int sleeper(void*) {
    waitForEnd();
}

// SIZE: two processes in one address space.
void oneAddressSpace(const Arguments& arguments) {
    mapTouched(arguments.size(0));
    constexpr size_t kStack = 64U << 10U;
    char* stack = map(kStack);
    const pid_t twin = clone(sleeper, stack + kStack, CLONE_VM | SIGCHLD, nullptr);
    require(twin > 0, "clone");
    reportAs("twin", twin);
}

// SIZE: a process whose first thread has ended.
void withoutFirstThread(const Arguments& arguments) {
    mapTouched(arguments.size(0));
    const auto first = static_cast<pid_t>(syscall(SYS_gettid));
    std::thread([first] {
        // The state of a thread that ended is told by its `stat`; there is nothing to wait on.
        const std::string path = "/proc/self/task/" + std::to_string(first) + "/stat";
        for (bool ended = false; !ended; sched_yield()) {
            std::string text;
            std::getline(std::ifstream(path), text);
            ended = text.find(") Z ") != std::string::npos;
        }
        reportAs("root");
        say("ready\n");
        waitForEnd();
    }).detach();
    syscall(SYS_exit, 0);
}

// FIRST SECOND: touches a part, forks, touches the next part of the same mapping, forks again.
void touchedBetweenForks(const Arguments& arguments) {
    char* memory = map(arguments.size(0) + arguments.size(1));
    touch(memory, arguments.size(0));
    spawn("A", [] {});
    touch(memory + arguments.size(0), arguments.size(1));
    spawn("B", [] {});
}

// SIZE: a chain of descendants, one of whom has ended, and a sibling that rewrote the first half.
void descendants(const Arguments& arguments) {
    const size_t size = arguments.size(0);
    char* memory = mapTouched(size);
    spawn("A", [] { spawn("AA", [] { spawn("AAA", [] {}); }); });
    spawn("sibling", [=] {
        touch(memory, size / 2);
        spawn("nephew", [] {});
    });
    spawnAndEnd([] { spawn("orphan", [] {}); });
    spawnAndEnd([] {});
}

// SIZE FORKED: forks if so wanted, then rewrites one page of every two, at random.
void alternating(const Arguments& arguments) {
    const size_t size = arguments.size(0);
    char* memory = mapTouched(size);
    if (arguments.count(1) != 0) {
        spawn("child", [] {});
    }
    std::minstd_rand random;
    for (size_t offset = 0; offset < size; offset += 2 * kPage) {
        touch(memory + offset + (random() / 8 % 2) * kPage, kPage);
    }
}

const std::map<std::string, void (*)(const Arguments&)> scenarios = {
    {"alternating", alternating},
    {"descendants", descendants},
    {"fork-tree", forkTree},
    {"one-address-space", oneAddressSpace},
    {"orphans-of-exec", orphansOfExec},
    {"page-kinds", pageKinds},
    {"plain", plain},
    {"private-file", privateFile},
    {"shared-objects", sharedObjects},
    {"swapped-then-forked", swappedThenForked},
    {"touched-between-forks", touchedBetweenForks},
    {"without-first-thread", withoutFirstThread},
};

}  // namespace

int main(int, char* argv[]) {
    std::istringstream words(argv[1]);
    std::string name;
    words >> name;
    scenarios.at(name)(Arguments(words));
    reportAs("root");
    say("ready\n");
    waitForEnd();
}

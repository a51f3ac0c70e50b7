#include "accuracy/Workload.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/personality.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <filesystem>
#include <sstream>
#include <stdexcept>

namespace {

// The program lies next to the test. It is executed through a descriptor, since the user that it is to run
// as may not reach its directory.
[[noreturn]] void runProgram(std::string scenario, const Workload::Conditions& conditions) {
    const auto path = std::filesystem::read_symlink("/proc/self/exe").replace_filename("accuracy_workload");
    const int program = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    setpgid(0, 0);
    if (!conditions.hasRandomAddresses) {
        personality(ADDR_NO_RANDOMIZE);
    }
    if (conditions.user) {
        becomeUser(*conditions.user);
    }
    std::string name = "workload";
    std::array<char*, 3> arguments = {name.data(), scenario.data(), nullptr};
    fexecve(program, arguments.data(), arguments.data() + 2);
    _exit(1);
}

}  // namespace

void becomeUser(uid_t user) {
    if (setgroups(0, nullptr) != 0 || setresgid(user, user, user) != 0 || setresuid(user, user, user) != 0 ||
        prctl(PR_SET_DUMPABLE, 1) != 0) {
        _exit(1);
    }
}

Workload::Workload(std::string scenario, const Conditions& conditions) {
    std::array<int, 2> ends = {};
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends.data()) != 0 || (_leader = fork()) < 0) {
        throw std::runtime_error("cannot start a workload");
    }
    if (_leader == 0) {
        dup2(ends[1], STDIN_FILENO);
        dup2(ends[1], STDOUT_FILENO);
        runProgram(std::move(scenario), conditions);
    }
    close(ends[1]);
    _socket = ends[0];
    _readReports();
    if (_pids.empty()) {
        _end();
        throw std::runtime_error("the workload " + scenario + " has failed");
    }
}

void Workload::_readReports() {
    std::string text;
    for (char byte = 0; !text.ends_with("ready\n"); text += byte) {
        if (read(_socket, &byte, 1) != 1) {
            return;
        }
    }
    std::istringstream words(text);
    std::string name;
    pid_t pid = 0;
    while (words >> name >> pid) {
        _pids.emplace(name, pid);
    }
}

Workload::~Workload() {
    _end();
}

// A process closes its files after it has given up its memory.
void Workload::_end() {
    shutdown(_socket, SHUT_WR);
    char byte = 0;
    while (read(_socket, &byte, 1) > 0) {
    }
    close(_socket);
    waitpid(_leader, nullptr, 0);
}

std::vector<pid_t> Workload::pids() const {
    std::vector<pid_t> pids;
    for (const auto& [name, pid] : _pids) {
        pids.push_back(pid);
    }
    return pids;
}

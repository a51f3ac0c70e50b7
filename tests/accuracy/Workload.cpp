#include "accuracy/Workload.h"

#include <fcntl.h>
#include <grp.h>
#include <sys/personality.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <sstream>
#include <stdexcept>

namespace {

// The program lies next to the test. It is executed through a descriptor, since the user that it is to run
// as may not reach its directory.
int openProgram() {
    const auto path = std::filesystem::read_symlink("/proc/self/exe").replace_filename("accuracy_workload");
    const int program = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (program < 0) {
        throw std::runtime_error("cannot open " + path.string());
    }
    return program;
}

[[noreturn]] void runProgram(int program, std::vector<std::string> texts,
                             const Workload::Conditions& conditions) {
    setpgid(0, 0);
    if (!conditions.hasRandomAddresses) {
        personality(ADDR_NO_RANDOMIZE);
    }
    if (conditions.user) {
        becomeUser(*conditions.user);
    }
    std::vector<char*> arguments;
    for (std::string& text : texts) {
        arguments.push_back(text.data());
    }
    arguments.push_back(nullptr);
    std::array<char*, 1> environment = {nullptr};
    fexecve(program, arguments.data(), environment.data());
    _exit(1);
}

}  // namespace

void becomeUser(uid_t user) {
    if (setgroups(0, nullptr) != 0 || setresgid(user, user, user) != 0 || setresuid(user, user, user) != 0 ||
        prctl(PR_SET_DUMPABLE, 1) != 0) {
        _exit(1);
    }
}

Workload::Workload(const std::string& scenario, const std::vector<std::string>& arguments,
                   Conditions conditions) {
    std::vector<std::string> texts = {"workload", scenario};
    texts.insert(texts.end(), arguments.begin(), arguments.end());
    const int program = openProgram();
    std::array<int, 2> reports = {};
    std::array<int, 2> lifeline = {};
    if (pipe2(reports.data(), O_CLOEXEC) != 0 || pipe2(lifeline.data(), O_CLOEXEC) != 0 ||
        (_leader = fork()) < 0) {
        throw std::runtime_error("cannot start a workload");
    }
    if (_leader == 0) {
        dup2(lifeline[0], STDIN_FILENO);
        dup2(reports[1], STDOUT_FILENO);
        runProgram(program, std::move(texts), conditions);
    }
    setpgid(_leader, _leader);
    close(program);
    close(reports[1]);
    close(lifeline[0]);
    _reports = reports[0];
    _lifeline = lifeline[1];
    _readReports();
    if (_pids.empty()) {
        _end();
        throw std::runtime_error("the workload " + scenario + " has failed");
    }
}

void Workload::_readReports() {
    std::string text;
    std::array<char, 4096> buffer = {};
    while (!text.ends_with("ready\n")) {
        const ssize_t count = read(_reports, buffer.data(), buffer.size());
        if (count <= 0) {
            return;
        }
        text.append(buffer.data(), static_cast<size_t>(count));
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
    close(_lifeline);
    kill(-_leader, SIGKILL);
    char byte = 0;
    while (read(_reports, &byte, 1) > 0) {
    }
    close(_reports);
    waitpid(_leader, nullptr, 0);
}

std::vector<pid_t> Workload::pids() const {
    std::vector<pid_t> pids;
    for (const auto& [name, pid] : _pids) {
        pids.push_back(pid);
    }
    return pids;
}

std::vector<pid_t> pidsOf(std::initializer_list<const Workload*> workloads) {
    std::vector<pid_t> pids;
    for (const Workload* workload : workloads) {
        const auto more = workload->pids();
        pids.insert(pids.end(), more.begin(), more.end());
    }
    return pids;
}

#include "support/ChildProcess.h"

#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <csignal>
#include <stdexcept>

namespace {

// An exception ends the child, which is not to go on with its parent's test.
[[noreturn]] void runChild(int answerPipe, const std::function<uint64_t()>& setUp) noexcept {
    prctl(PR_SET_PDEATHSIG, SIGKILL);
    const uint64_t answer = setUp();
    if (write(answerPipe, &answer, sizeof(answer)) != sizeof(answer)) {
        _exit(1);
    }
    while (true) {
        pause();
    }
}

}  // namespace

ChildProcess::ChildProcess(const std::function<uint64_t()>& setUp) {
    std::array<int, 2> answers = {};
    if (pipe(answers.data()) != 0 || (_pid = fork()) < 0) {
        throw std::runtime_error("cannot start a child process");
    }
    if (_pid == 0) {
        close(answers[0]);
        runChild(answers[1], setUp);
    }
    close(answers[1]);
    const bool answered = read(answers[0], &_answer, sizeof(_answer)) == sizeof(_answer);
    close(answers[0]);
    if (!answered) {
        reap();
        throw std::runtime_error("the child process ended in its set-up");
    }
}

ChildProcess::~ChildProcess() {
    reap();
}

void ChildProcess::kill() {
    ::kill(_pid, SIGKILL);
    siginfo_t info = {};
    waitid(P_PID, static_cast<id_t>(_pid), &info, WEXITED | WNOWAIT);
}

void ChildProcess::reap() {
    if (!_reaped) {
        ::kill(_pid, SIGKILL);
        waitpid(_pid, nullptr, 0);
        _reaped = true;
    }
}

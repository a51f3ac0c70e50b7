#pragma once

#include <sys/types.h>

#include <cstdint>
#include <functional>

/// A real process for measuring: a fork of the test that runs `setUp` and then sleeps until it is ended.
/// Construction returns once `setUp` has run; its result (an address, say) is `answer`.
class ChildProcess {
public:
    explicit ChildProcess(const std::function<uint64_t()>& setUp = [] { return uint64_t{0}; });
    ~ChildProcess();
    ChildProcess(const ChildProcess&) = delete;
    ChildProcess& operator=(const ChildProcess&) = delete;

    pid_t pid() const { return _pid; }
    uint64_t answer() const { return _answer; }
    /// Ends the process and leaves it unreaped: a zombie.
    void kill();
    /// Ends and reaps it: its pid is free.
    void reap();

private:
    pid_t _pid = -1;
    uint64_t _answer = 0;
    bool _reaped = false;
};

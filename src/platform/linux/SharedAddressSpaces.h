#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <unordered_map>
#include <vector>

/// A process by what names it for good: its pid can be given away, its start time cannot.
struct ProcessIdentity {
    int32_t pid = 0;
    uint64_t startTime = 0;  ///< clock ticks since boot

    bool operator==(const ProcessIdentity&) const = default;
};

/// Processes that share one address space outright (vfork, CLONE_VM): everything private to one of them is
/// the same memory in the others. Safe for use from several threads.
class SharedAddressSpaces {
public:
    /// `thread` is a thread of the process that still runs; `startStack` tells candidates from the rest (a
    /// fork has its parent's too, so the kernel is asked whether the space really is one).
    struct Candidate {
        ProcessIdentity process;
        int32_t thread;
        uint64_t startStack;
    };
    /// Under whose name the memory of this process goes: its own, or that of the first process met with the
    /// same address space. Costs nothing for a program that runs once, else log n calls of kcmp.
    ProcessIdentity ownerOf(const Candidate& candidate);
    /// The process is not looked at any more.
    void forget(const ProcessIdentity& process);

private:
    struct Member {
        ProcessIdentity process;
        int32_t thread;
    };
    using Members = std::vector<Member>;

    static std::optional<size_t> _place(Members& members, int32_t thread);

    std::mutex _mutex;
    std::unordered_map<uint64_t, Members> _members;  ///< by start of stack, in the kernel's order of spaces
    std::unordered_multimap<int32_t, uint64_t> _startStacks;  ///< by pid: where the process is a member
};

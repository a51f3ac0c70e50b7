#pragma once

#include <cstdint>
#include <mutex>
#include <unordered_map>
#include <unordered_set>

#include "platform/linux/ObjectIdentity.h"

/// Which processes are the only ones of their exec: nobody shares their memory by fork, so that nothing has
/// to be looked up page by page. Holds for one measurement: a child that is forked after the processes of the
/// measurement were listed is not measured. Safe for use from several threads.
///
/// A program is known by its auxiliary vector, which forks have in common and which every exec makes anew, at
/// random addresses. Where addresses are not random, runs of one program pass for each other's forks. Nothing
/// is read from the processes' memory: that would wait for whoever has locked their memory maps.
class ForkCensus {
public:
    /// `proc` is a descriptor of /proc.
    ForkCensus(int proc, const ObjectIdentity& identity) : _proc(proc), _identity(identity) {}

    void begin();
    /// A process without memory of its own that there will be until the next listing: nobody's fork.
    void addKernelThread(int32_t pid);
    /// The system's processes are listed anew.
    void forgetKernelThreads();
    /// A process that is measured; `program` stands for its auxiliary vector, 0 where that is not known.
    void add(int32_t pid, uint64_t program);
    /// How many were added.
    size_t measured() const;
    /// Of a process that was added. The first question looks at all the others of the system; to those that
    /// are asked meanwhile, and to all when it gets no answer, nobody is alone.
    bool isAlone(int32_t pid);

private:
    void _add(int32_t pid, uint64_t program);
    bool _lookAtOthers();

    int _proc;
    const ObjectIdentity& _identity;
    mutable std::mutex _mutex;                        ///< guards what follows
    std::unordered_map<int32_t, uint64_t> _programs;  ///< by pid
    std::unordered_map<uint64_t, size_t> _members;    ///< by program
    std::unordered_set<int32_t> _kernelThreads;
    size_t _measured = 0;
    bool _complete = false;
    bool _isLooking = false;    ///< a thread looks at the others
    uint64_t _measurement = 0;  ///< their number: what was begun for an earlier one comes too late
};

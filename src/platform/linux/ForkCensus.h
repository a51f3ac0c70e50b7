#pragma once

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <unordered_map>

/// Which processes of a measurement are the only ones of their exec: what they share by fork they share with
/// nobody who is measured, so that no page has to be looked up for its sharers. A child that is forked after
/// the processes of the measurement were listed is not measured. Safe for use from several threads.
///
/// An exec is known by the address of the random bytes on its stack, itself random, which forks have in
/// common. Where addresses are not random, runs of one program pass for each other's forks. Nothing is read
/// from the processes' memory: that would wait for whoever has locked their memory maps. The rest of the
/// auxiliary vector says less: a process can have it changed.
class ForkCensus {
public:
    void begin();
    /// A process that is measured; `exec` is the address of its random bytes, 0 where that is not known: it
    /// can then be anybody's fork.
    void add(int32_t pid, uint64_t exec);
    /// One that was saved, of whatever exec.
    void addSaved();
    /// How many living ones were added.
    size_t measured() const;
    /// Not of one that was never added: who is measured beside it is not known.
    bool isAlone(int32_t pid) const;

private:
    mutable std::mutex _mutex;                      ///< guards what follows
    std::unordered_map<int32_t, uint64_t> _execs;   ///< by pid
    std::unordered_map<uint64_t, size_t> _members;  ///< by exec
    bool _anybodyCanBeMeasured = false;
};

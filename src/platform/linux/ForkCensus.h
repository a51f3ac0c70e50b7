#pragma once

#include <cstddef>
#include <cstdint>
#include <mutex>
#include <unordered_map>

/// Which processes of a measurement are the only ones of their exec: what they share by fork they share with
/// nobody who is measured, so that no page has to be looked up for its sharers. A child that is forked after
/// the processes of the measurement were listed is not measured. Safe for use from several threads.
///
/// A program is known by its auxiliary vector, which forks have in common and which every exec makes anew, at
/// random addresses. Where addresses are not random, runs of one program pass for each other's forks. Nothing
/// is read from the processes' memory: that would wait for whoever has locked their memory maps.
class ForkCensus {
public:
    void begin();
    /// A process that is measured; `program` stands for its auxiliary vector, 0 where that is not known.
    void add(int32_t pid, uint64_t program);
    /// One that was saved, of whatever program.
    void addSaved();
    /// How many living ones were added.
    size_t measured() const;
    /// Not of one that was never added: who is measured beside it is not known.
    bool isAlone(int32_t pid) const;

private:
    mutable std::mutex _mutex;                        ///< guards what follows
    std::unordered_map<int32_t, uint64_t> _programs;  ///< by pid
    std::unordered_map<uint64_t, size_t> _members;    ///< by program
    bool _hasSaved = false;
};

#pragma once

#include <cstdint>
#include <mutex>
#include <optional>
#include <unordered_map>

#include "platform/linux/ObjectIdentity.h"

/// Which processes are the only ones of their exec: nobody shares their memory by fork, so that nothing has
/// to be looked up page by page. Holds for one measurement: a child that is forked after the processes of the
/// measurement were listed is not measured. Safe for use from several threads.
class ForkCensus {
public:
    /// `proc` is a descriptor of /proc.
    ForkCensus(int proc, const ObjectIdentity& identity) : _proc(proc), _identity(identity) {}

    void begin();
    /// A process that is measured, with its `randomBytesIdentifier`.
    void add(int32_t pid, std::optional<uint64_t> identifier);
    /// How many were added.
    size_t measured() const;
    /// Of a process that was added. The first question looks at all the others of the system.
    bool isAlone(int32_t pid);

private:
    void _add(int32_t pid, std::optional<uint64_t> identifier);
    void _addOthers();

    int _proc;
    const ObjectIdentity& _identity;
    mutable std::mutex _mutex;  ///< guards what follows
    std::unordered_map<int32_t, std::optional<uint64_t>> _identifiers;
    std::unordered_map<uint64_t, size_t> _members;  ///< by identifier
    size_t _measured = 0;
    bool _complete = false;
};

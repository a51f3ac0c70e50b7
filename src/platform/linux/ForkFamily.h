#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string_view>

#include "platform/linux/FrameGenerations.h"
#include "platform/linux/ObjectIdentity.h"

/// The processes of one exec, and what has been seen of the memory they share.
class ForkFamily {
public:
    explicit ForkFamily(uint64_t identifier) : _identifier(identifier) {}

    uint64_t identifier() const { return _identifier; }
    FrameGenerations& generations() { return _generations; }

    /// Remembers a member's part of the memory that the family shares: its bytes, each divided by the number
    /// of processes that map it. The parts of all members add up to the memory.
    void setPart(int32_t pid, uint64_t bytes);
    uint64_t sumOfParts() const;

private:
    uint64_t _identifier;
    FrameGenerations _generations;
    mutable std::mutex _mutex;
    std::map<int32_t, uint64_t> _parts;
};

/// The families that processes of the run belong to. A family, and the memory it takes here, lives as long as
/// somebody holds it: frames that were seen in an earlier sample say nothing about a later one. Safe for use
/// from several threads.
class ForkFamilies {
public:
    std::shared_ptr<ForkFamily> family(uint64_t identifier);

private:
    std::mutex _mutex;
    std::map<uint64_t, std::weak_ptr<ForkFamily>> _families;
};

/// Which processes can share memory by fork: those that come from the same exec. exec puts 16 random bytes on
/// the new stack and fork copies them, so equal bytes mean the same family. They also seed the program's
/// stack protector, so they leave this function only through a keyed one-way hash.
///
/// Where reading memory is refused, the addresses in `auxv`, which are random too, serve instead; and without
/// address randomisation, when unrelated processes have the same ones, the oldest of a chain of parents that
/// run the same executable.
///
/// `procDirectory` and `processDirectory` are descriptors of /proc and /proc/PID. Costs four system calls.
uint64_t forkFamilyIdentifier(int procDirectory, int processDirectory, int32_t pid,
                              const ObjectIdentity& identity);

/// The same by the random bytes alone, which the text of `auxv` says where to find; none where they cannot be
/// read.
std::optional<uint64_t> randomBytesIdentifier(std::string_view auxv, int32_t pid,
                                              const ObjectIdentity& identity);

/// The address of the random bytes in the text of `auxv`.
std::optional<uint64_t> randomBytesAddress(std::string_view auxv);

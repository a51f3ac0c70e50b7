#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <span>
#include <unordered_map>
#include <utility>

#include "platform/linux/Procfs.h"

/// Bytes that sockets hold in the kernel, by the socket's inode.
using SocketBytes = std::unordered_map<uint64_t, uint64_t>;

namespace sockdiag {

/// The families that the kernel lists, each in messages of its own.
enum class Family : uint8_t { tcp, datagram, local, netlink, packet };
inline constexpr std::array kFamilies = {Family::tcp, Family::datagram, Family::local, Family::netlink,
                                         Family::packet};

/// Adds what one part of a family's list tells; false when it was the last one. Parts that are cut are read
/// for what they hold.
///
/// Counted is what waits to be read or sent, with the kernel's overhead, not what the socket may use. What a
/// local socket wrote stays its own until the peer has read it, and becomes the peer's when the writer is
/// closed.
bool readPart(std::span<const std::byte> part, Family family, SocketBytes& bytes);

}  // namespace sockdiag

/// The sockets of one network namespace, each family listed once, when the first socket of it is asked about:
/// the list of TCP sockets alone takes milliseconds. Needs no privilege in the caller's own namespace;
/// another one has to be entered, which a thread made for it does.
class SocketMemory {
public:
    /// Of the namespace with this number, in which the process with this directory is. None where it cannot
    /// be entered, or where the kernel has no such lists.
    static std::unique_ptr<SocketMemory> ofNamespace(uint64_t number, int processDirectory);

    /// None for a socket that is not in the namespace. `descriptor` is the entry that leads to the socket in
    /// `directory`, a process's "fd".
    std::optional<uint64_t> bytesOf(uint64_t inode, int directory, const char* descriptor);

private:
    explicit SocketMemory(procfs::Descriptor connection) : _connection(std::move(connection)) {}
    void _list(sockdiag::Family family);

    procfs::Descriptor _connection;
    std::set<sockdiag::Family> _listed;
    SocketBytes _bytes;
};

#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <unordered_map>

/// Bytes that sockets hold in the kernel, by the socket's inode; sockets that hold none are left out.
using SocketBytes = std::unordered_map<uint64_t, uint64_t>;

/// One look at all sockets of the network namespace of the process with this directory. Needs no privilege in
/// the caller's own namespace; another one has to be entered, which a thread made for it does. Empty where
/// that is refused or the kernel has no such interface; families that it does not serve are left out.
SocketBytes socketBytes(int processDirectory);

namespace sockdiag {

/// The families that the kernel lists, each in messages of its own.
enum class Family : uint8_t { tcp, datagram, local, netlink, packet };

/// Adds what one part of a family's list tells; false when it was the last one. Parts that are cut are read
/// for what they hold.
///
/// Counted is what waits to be read or sent, with the kernel's overhead, not what the socket may use. What a
/// local socket wrote stays its own until the peer has read it, and becomes the peer's when the writer is
/// closed.
bool readPart(std::span<const std::byte> part, Family family, SocketBytes& bytes);

}  // namespace sockdiag

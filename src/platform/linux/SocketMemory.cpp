#include "platform/linux/SocketMemory.h"

#include <fcntl.h>
#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/netlink_diag.h>
#include <linux/packet_diag.h>
#include <linux/sock_diag.h>
#include <linux/unix_diag.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/xattr.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstring>
#include <iterator>
#include <string>
#include <string_view>
#include <system_error>
#include <thread>
#include <vector>

namespace sockdiag {

namespace {

using Bytes = std::span<const std::byte>;

/// The structure at the beginning of the bytes; what they are too short for is 0.
template <class Structure>
Structure readAs(Bytes bytes) {
    Structure structure = {};
    std::memcpy(&structure, bytes.data(), std::min(sizeof(structure), bytes.size()));
    return structure;
}

Bytes without(Bytes bytes, size_t count) {
    return bytes.subspan(std::min(count, bytes.size()));
}

size_t aligned(size_t length) {
    return (length + NLA_ALIGNTO - 1) / NLA_ALIGNTO * NLA_ALIGNTO;
}

/// The attributes of one socket that are read.
struct Attributes {
    std::array<uint32_t, SK_MEMINFO_VARS> memory = {};
    uint64_t unread = 0;  ///< of a local socket
    bool peerIsGone = false;

    uint64_t bytes(Family family) const {
        const size_t written = family == Family::tcp ? SK_MEMINFO_WMEM_QUEUED : SK_MEMINFO_WMEM_ALLOC;
        return uint64_t{memory[SK_MEMINFO_RMEM_ALLOC]} + memory[written] + memory[SK_MEMINFO_OPTMEM] +
               memory[SK_MEMINFO_BACKLOG] + (peerIsGone ? unread : 0);
    }
};

void readLocal(uint16_t type, Bytes value, Attributes& attributes) {
    if (type == UNIX_DIAG_MEMINFO) {
        attributes.memory = readAs<decltype(attributes.memory)>(value);
    } else if (type == UNIX_DIAG_RQLEN) {
        attributes.unread = readAs<unix_diag_rqlen>(value).udiag_rqueue;
    } else if (type == UNIX_DIAG_PEER) {
        attributes.peerIsGone = readAs<uint32_t>(value) == 0;
    }
}

uint16_t memoryAttribute(Family family) {
    if (family == Family::netlink) {
        return NETLINK_DIAG_MEMINFO;
    }
    return family == Family::packet ? uint16_t{PACKET_DIAG_MEMINFO} : uint16_t{INET_DIAG_SKMEMINFO};
}

void readAttribute(Family family, uint16_t type, Bytes value, Attributes& attributes) {
    if (family == Family::local) {
        readLocal(type, value, attributes);
    } else if (type == memoryAttribute(family)) {
        attributes.memory = readAs<decltype(attributes.memory)>(value);
    }
}

Attributes readAttributes(Family family, Bytes bytes) {
    Attributes attributes;
    while (bytes.size() >= sizeof(nlattr)) {
        const auto header = readAs<nlattr>(bytes);
        const size_t length = std::min<size_t>(header.nla_len, bytes.size());
        if (length < sizeof(nlattr)) {
            break;
        }
        readAttribute(family, header.nla_type & NLA_TYPE_MASK,
                      bytes.subspan(sizeof(nlattr), length - sizeof(nlattr)), attributes);
        bytes = without(bytes, aligned(length));
    }
    return attributes;
}

struct Socket {
    uint64_t inode;
    Bytes attributes;
};

template <class Message>
Socket socketOf(Bytes bytes, uint32_t Message::*inode) {
    return {readAs<Message>(bytes).*inode, without(bytes, aligned(sizeof(Message)))};
}

Socket readSocket(Family family, Bytes bytes) {
    switch (family) {
        case Family::tcp:
        case Family::datagram:
            return socketOf(bytes, &inet_diag_msg::idiag_inode);
        case Family::local:
            return socketOf(bytes, &unix_diag_msg::udiag_ino);
        case Family::netlink:
            return socketOf(bytes, &netlink_diag_msg::ndiag_ino);
        case Family::packet:
            return socketOf(bytes, &packet_diag_msg::pdiag_ino);
    }
    return {};
}

// Connections that nobody has accepted yet and sockets that nobody holds any more have no inode. One that
// goes several ways at once stands there once for each.
void addSocket(Family family, Bytes message, SocketBytes& bytes) {
    const Socket socket = readSocket(family, message);
    if (socket.inode != 0) {
        bytes[socket.inode] += readAttributes(family, socket.attributes).bytes(family);
    }
}

}  // namespace

bool readPart(Bytes part, Family family, SocketBytes& bytes) {
    while (part.size() >= sizeof(nlmsghdr)) {
        const auto header = readAs<nlmsghdr>(part);
        const size_t length = std::min<size_t>(header.nlmsg_len, part.size());
        if (length < sizeof(nlmsghdr) || header.nlmsg_type == NLMSG_DONE ||
            header.nlmsg_type == NLMSG_ERROR) {
            return false;
        }
        if (header.nlmsg_type == SOCK_DIAG_BY_FAMILY || header.nlmsg_type == TCPDIAG_GETSOCK) {
            addSocket(family, part.subspan(sizeof(nlmsghdr), length - sizeof(nlmsghdr)), bytes);
        }
        part = without(part, aligned(length));
    }
    return true;
}

}  // namespace sockdiag

namespace {

using sockdiag::Family;

/// Asks a connection to the kernel's lists for one of them. The rings of packet sockets are left out: their
/// processes map them.
class SocketList {
public:
    SocketList(int connection, SocketBytes& bytes)
        : _connection(connection), _bytes(bytes), _buffer(kLargestPart) {}

    /// False when an answer was broken off.
    bool read(Family family) {
        switch (family) {
            case Family::tcp:
                _readStreams();
                break;
            case Family::datagram:
                _readDatagrams();
                break;
            case Family::local:
                _readLocal();
                break;
            case Family::netlink:
                _readNetlink();
                break;
            case Family::packet:
                _readPacket();
                break;
        }
        return !_isBroken;
    }

private:
    static constexpr size_t kLargestPart = size_t{64} << 10U;
    static constexpr uint8_t kMemory = 1U << (INET_DIAG_SKMEMINFO - 1U);

    // The older question, which is for all address families at once: the kernel goes through its whole table
    // of connections for each question, however few there are.
    void _readStreams() {
        inet_diag_req request = {};
        request.idiag_ext = kMemory;
        request.idiag_states = UINT32_MAX;
        _read(Family::tcp, request, TCPDIAG_GETSOCK);
    }

    void _readDatagrams() {
        inet_diag_req_v2 request = {};
        request.idiag_ext = kMemory;
        request.idiag_states = UINT32_MAX;
        for (const uint8_t addressFamily : {uint8_t{AF_INET}, uint8_t{AF_INET6}}) {
            for (const uint8_t protocol :
                 {uint8_t{IPPROTO_UDP}, uint8_t{IPPROTO_UDPLITE}, uint8_t{IPPROTO_RAW}}) {
                request.sdiag_family = addressFamily;
                request.sdiag_protocol = protocol;
                _read(Family::datagram, request);
            }
        }
    }

    void _readLocal() {
        unix_diag_req request = {};
        request.sdiag_family = AF_UNIX;
        request.udiag_states = UINT32_MAX;
        request.udiag_show = UDIAG_SHOW_MEMINFO | UDIAG_SHOW_RQLEN | UDIAG_SHOW_PEER;
        _read(Family::local, request);
    }

    void _readNetlink() {
        netlink_diag_req request = {};
        request.sdiag_family = AF_NETLINK;
        request.sdiag_protocol = NDIAG_PROTO_ALL;
        request.ndiag_show = NDIAG_SHOW_MEMINFO;
        _read(Family::netlink, request);
    }

    void _readPacket() {
        packet_diag_req request = {};
        request.sdiag_family = AF_PACKET;
        request.pdiag_show = PACKET_SHOW_MEMINFO;
        _read(Family::packet, request);
    }

    template <class Request>
    void _read(Family family, const Request& request, uint16_t question = SOCK_DIAG_BY_FAMILY) {
        struct {
            nlmsghdr header;
            Request request;
        } message = {.header = {.nlmsg_len = sizeof(message),
                                .nlmsg_type = question,
                                .nlmsg_flags = NLM_F_REQUEST | NLM_F_DUMP,
                                .nlmsg_seq = 0,
                                .nlmsg_pid = 0},
                     .request = request};
        if (send(_connection, &message, sizeof(message), 0) < 0) {
            return;
        }
        while (_readPart(family)) {
        }
    }

    bool _readPart(Family family) {
        ssize_t count = 0;
        do {
            count = recv(_connection, _buffer.data(), _buffer.size(), 0);
        } while (count < 0 && errno == EINTR);
        _isBroken = _isBroken || count <= 0;
        return count > 0 &&
               sockdiag::readPart(std::span(_buffer).first(static_cast<size_t>(count)), family, _bytes);
    }

    int _connection;
    SocketBytes& _bytes;
    std::vector<std::byte> _buffer;
    bool _isBroken = false;
};

/// In which lists a socket can stand, by the name of its protocol; all where the kernel does not tell it.
std::vector<Family> familiesOf(int directory, const char* descriptor) {
    std::array<char, 64> buffer = {};
    const std::string path = "/proc/self/fd/" + std::to_string(directory) + "/" + descriptor;
    const ssize_t length = getxattr(path.c_str(), "system.sockprotoname", buffer.data(), buffer.size() - 1);
    if (length < 0) {
        return {sockdiag::kFamilies.begin(), sockdiag::kFamilies.end()};
    }
    struct Protocol {
        std::string_view name;
        Family family;
    };
    constexpr Protocol kProtocols[] = {{"TCP", Family::tcp},         {"MPTCP", Family::tcp},
                                       {"UNIX", Family::local},      {"UDP", Family::datagram},
                                       {"RAW", Family::datagram},    {"PING", Family::datagram},
                                       {"NETLINK", Family::netlink}, {"PACKET", Family::packet}};
    const std::string_view name = buffer.data();
    const auto* protocol = std::ranges::find_if(
        kProtocols, [=](const Protocol& candidate) { return name.starts_with(candidate.name); });
    return protocol == std::end(kProtocols) ? std::vector<Family>() : std::vector{protocol->family};
}

// The kernel answers at once; the time limit is for one that does not.
procfs::Descriptor connectHere() {
    procfs::Descriptor connection(socket(AF_NETLINK, SOCK_RAW | SOCK_CLOEXEC, NETLINK_SOCK_DIAG));
    constexpr timeval kLimit = {.tv_sec = 1, .tv_usec = 0};
    setsockopt(connection.get(), SOL_SOCKET, SO_RCVTIMEO, &kLimit, sizeof(kLimit));
    return connection;
}

// A socket stays in the namespace that it was made in, so a thread that ends again is enough to be there.
procfs::Descriptor connectIn(const procfs::Descriptor& networkNamespace) {
    procfs::Descriptor connection;
    try {
        std::thread([&] {
            if (setns(networkNamespace.get(), CLONE_NEWNET) == 0) {
                connection = connectHere();
            }
        }).join();
    } catch (const std::system_error&) {
        // No thread to be had.
    }
    return connection;
}

procfs::Descriptor connectTo(uint64_t number, int processDirectory) {
    const procfs::Descriptor self = procfs::open(AT_FDCWD, "/proc/thread-self", O_PATH);
    if (number != 0 && number == procfs::readNamespace(self.get(), "net")) {
        return connectHere();
    }
    const procfs::Descriptor networkNamespace = procfs::open(processDirectory, "ns/net");
    return networkNamespace ? connectIn(networkNamespace) : procfs::Descriptor();
}

}  // namespace

std::unique_ptr<SocketMemory> SocketMemory::ofNamespace(uint64_t number, int processDirectory) {
    procfs::Descriptor connection = connectTo(number, processDirectory);
    if (!connection) {
        return nullptr;
    }
    return std::unique_ptr<SocketMemory>(new SocketMemory(std::move(connection)));
}

// After an answer that was broken off, what comes next would be taken for the answer to the next question.
void SocketMemory::_list(Family family) {
    if (_listed.insert(family).second && _connection && !SocketList(_connection.get(), _bytes).read(family)) {
        _connection.reset();
    }
}

std::optional<uint64_t> SocketMemory::bytesOf(uint64_t inode, int directory, const char* descriptor) {
    if (_listed.size() < sockdiag::kFamilies.size() && !_bytes.contains(inode)) {
        for (const Family family : familiesOf(directory, descriptor)) {
            _list(family);
        }
    }
    const auto found = _bytes.find(inode);
    return found == _bytes.end() ? std::nullopt : std::optional(found->second);
}

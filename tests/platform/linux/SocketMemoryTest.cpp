#include "platform/linux/SocketMemory.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/inet_diag.h>
#include <linux/netlink.h>
#include <linux/packet_diag.h>
#include <linux/sock_diag.h>
#include <linux/unix_diag.h>
#include <netinet/in.h>
#include <sched.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <array>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "platform/linux/Procfs.h"
#include "support/ChildProcess.h"

namespace {

using sockdiag::Family;
using Message = std::vector<std::byte>;

template <class Structure>
void append(Message& to, const Structure& structure) {
    const auto* bytes = reinterpret_cast<const std::byte*>(&structure);
    to.insert(to.end(), bytes, bytes + sizeof(structure));
    to.resize((to.size() + 3) / 4 * 4);
}

template <class Value>
void appendAttribute(Message& to, uint16_t type, const Value& value) {
    append(to, nlattr{static_cast<uint16_t>(sizeof(nlattr) + sizeof(value)), type});
    append(to, value);
}

/// Receive 1, receive limit, send 20, send limit, forward 300, queued 4000, options 50000, backlog 600000.
constexpr std::array<uint32_t, SK_MEMINFO_VARS> kMemory = {1,    77777777, 20,     77777777, 300,
                                                           4000, 50000,    600000, 9};

template <class Body>
Message message(const Body& body, const Message& attributes) {
    Message result;
    append(result,
           nlmsghdr{.nlmsg_len = static_cast<uint32_t>(sizeof(nlmsghdr) + sizeof(body) + attributes.size()),
                    .nlmsg_type = SOCK_DIAG_BY_FAMILY,
                    .nlmsg_flags = NLM_F_MULTI,
                    .nlmsg_seq = 0,
                    .nlmsg_pid = 0});
    append(result, body);
    result.insert(result.end(), attributes.begin(), attributes.end());
    return result;
}

Message internetSocket(uint32_t inode) {
    Message attributes;
    appendAttribute(attributes, INET_DIAG_SHUTDOWN, uint8_t{1});
    appendAttribute(attributes, INET_DIAG_SKMEMINFO, kMemory);
    inet_diag_msg body = {};
    body.idiag_inode = inode;
    return message(body, attributes);
}

Message localSocket(uint32_t inode, std::optional<uint32_t> peer, uint32_t unread) {
    Message attributes;
    if (peer) {
        appendAttribute(attributes, UNIX_DIAG_PEER, *peer);
    }
    appendAttribute(attributes, UNIX_DIAG_RQLEN, unix_diag_rqlen{unread, 0});
    appendAttribute(attributes, UNIX_DIAG_MEMINFO, kMemory);
    unix_diag_msg body = {};
    body.udiag_ino = inode;
    return message(body, attributes);
}

uint64_t bytesOf(const Message& socket, Family family, uint64_t inode) {
    SocketBytes bytes;
    EXPECT_TRUE(sockdiag::readPart(socket, family, bytes));
    return bytes.contains(inode) ? bytes.at(inode) : 0;
}

TEST(SocketMessages, WhatWaitsIsCountedAndNotWhatIsAllowed) {
    EXPECT_EQ(bytesOf(internetSocket(7), Family::tcp, 7), 654001U);
    EXPECT_EQ(bytesOf(internetSocket(7), Family::datagram, 7), 650021U);
    SocketBytes bytes;
    EXPECT_TRUE(sockdiag::readPart(internetSocket(0), Family::tcp, bytes));
    EXPECT_TRUE(bytes.empty()) << "nobody's";
    EXPECT_EQ(bytesOf(localSocket(8, 9, 1000000), Family::local, 8), 650021U) << "the peer has what it wrote";
    EXPECT_EQ(bytesOf(localSocket(8, 0, 1000000), Family::local, 8), 1650021U);
    EXPECT_EQ(bytesOf(localSocket(8, std::nullopt, 5), Family::local, 8), 650021U)
        << "a listener's count is one of connections";
}

TEST(SocketMessages, TheListEndsWithAMessageOfItsOwn) {
    Message part = internetSocket(7);
    append(part, nlmsghdr{sizeof(nlmsghdr), NLMSG_DONE, 0, 0, 0});
    const Message behind = internetSocket(8);
    part.insert(part.end(), behind.begin(), behind.end());
    SocketBytes bytes;
    EXPECT_FALSE(sockdiag::readPart(part, Family::tcp, bytes));
    EXPECT_EQ(bytes.size(), 1U);
    Message error;
    append(error, nlmsghdr{sizeof(nlmsghdr) + sizeof(nlmsgerr), NLMSG_ERROR, 0, 0, 0});
    append(error, nlmsgerr{-2, {}});
    EXPECT_FALSE(sockdiag::readPart(error, Family::tcp, bytes));
}

TEST(SocketMessages, AnyBytesAreRead) {
    const Message whole = localSocket(8, 0, 1000);
    for (size_t length = 0; length <= whole.size(); ++length) {
        SocketBytes bytes;
        sockdiag::readPart(std::span(whole).first(length), Family::local, bytes);
        EXPECT_LE(bytes.contains(8) ? bytes.at(8) : 0, 651021U) << length;
    }
    std::mt19937 random(1);
    for (int round = 0; round < 20000; ++round) {
        Message damaged = whole;
        damaged[random() % damaged.size()] = static_cast<std::byte>(random());
        damaged[random() % damaged.size()] = static_cast<std::byte>(random());
        SocketBytes bytes;
        sockdiag::readPart(damaged, static_cast<Family>(random() % 5), bytes);
        EXPECT_LE(bytes.size(), damaged.size() / sizeof(nlmsghdr)) << "no more sockets than messages";
    }
}

/// What the socket holds that is this descriptor of a process.
uint64_t bytesOfDescriptor(pid_t pid, int socket) {
    const std::string path = "/proc/" + std::to_string(pid);
    const std::string number = std::to_string(socket);
    const procfs::Descriptor process = procfs::open(AT_FDCWD, path.c_str(), O_PATH);
    const procfs::Descriptor descriptors = procfs::open(process.get(), "fd", O_DIRECTORY);
    struct stat status = {};
    EXPECT_EQ(fstatat(descriptors.get(), number.c_str(), &status, 0), 0);
    const auto sockets =
        SocketMemory::ofNamespace(procfs::readNamespace(process.get(), "net"), process.get());
    return sockets == nullptr
               ? 0
               : sockets->bytesOf(status.st_ino, descriptors.get(), number.c_str()).value_or(0);
}

uint64_t liveBytes(const procfs::Descriptor& socket) {
    return bytesOfDescriptor(getpid(), socket.get());
}

/// Writes until no more fits; the number of bytes.
uint64_t fill(int socket) {
    const std::string data(4096, 'x');
    uint64_t written = 0;
    for (ssize_t count = 0; (count = send(socket, data.data(), data.size(), MSG_DONTWAIT)) > 0;) {
        written += static_cast<uint64_t>(count);
    }
    return written;
}

TEST(SocketMemory, LocalBytesAreTheWritersUntilItIsClosed) {
    int ends[2] = {-1, -1};
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    procfs::Descriptor writer(ends[0]);
    const procfs::Descriptor reader(ends[1]);
    const uint64_t written = fill(writer.get());
    ASSERT_GT(written, 10000U);
    EXPECT_GE(liveBytes(writer), written);
    EXPECT_EQ(liveBytes(reader), 0U);
    writer.reset();
    EXPECT_EQ(liveBytes(reader), written);
}

TEST(SocketMemory, DatagramsAreTheReceivers) {
    const procfs::Descriptor receiver(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    const procfs::Descriptor sender(socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t length = sizeof(address);
    ASSERT_EQ(bind(receiver.get(), reinterpret_cast<sockaddr*>(&address), sizeof(address)), 0);
    getsockname(receiver.get(), reinterpret_cast<sockaddr*>(&address), &length);
    const std::string data(1000, 'x');
    for (int datagram = 0; datagram < 50; ++datagram) {
        sendto(sender.get(), data.data(), data.size(), 0, reinterpret_cast<sockaddr*>(&address),
               sizeof(address));
    }
    EXPECT_GE(liveBytes(receiver), 50U * 1000U);
}

TEST(SocketMemory, StreamsOfBothAddressFamilies) {
    for (const int family : {AF_INET, AF_INET6}) {
        const procfs::Descriptor listener(socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_storage address = {};
        socklen_t length = sizeof(address);
        if (!listener || listen(listener.get(), 1) != 0) {
            continue;  // a system without IPv6
        }
        getsockname(listener.get(), reinterpret_cast<sockaddr*>(&address), &length);
        const procfs::Descriptor writer(socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0));
        ASSERT_EQ(connect(writer.get(), reinterpret_cast<sockaddr*>(&address), length), 0);
        const procfs::Descriptor reader(accept(listener.get(), nullptr, nullptr));
        const uint64_t written = fill(writer.get());
        EXPECT_GE(liveBytes(reader) + liveBytes(writer), written) << "where the kernel put them";
    }
}

TEST(SocketMemory, AnotherNamespaceIsEntered) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs the right to enter namespaces";
    }
    const ChildProcess process([] {
        int ends[2] = {-1, -1};
        if (unshare(CLONE_NEWNET) != 0 || socketpair(AF_UNIX, SOCK_STREAM, 0, ends) != 0) {
            return uint64_t{0};
        }
        return fill(ends[0]) == 0 ? 0 : static_cast<uint64_t>(ends[0]);
    });
    ASSERT_NE(process.answer(), 0U);
    EXPECT_GT(bytesOfDescriptor(process.pid(), static_cast<int>(process.answer())), 10000U);
    EXPECT_EQ(SocketMemory::ofNamespace(1, -1), nullptr) << "a namespace that cannot be entered";
}

}  // namespace

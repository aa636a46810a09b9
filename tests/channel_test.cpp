#include "ZEL/channel.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <sys/resource.h>

#include <atomic>
#include <climits>
#include <cstring>
#include <thread>

#include "ZEL/internal/cert_name.h"
#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "tests/support/log_capture.h"
#include "tests/support/sockets.h"

using testing::AllOf;
using testing::EndsWith;
using testing::HasSubstr;
using ZEL::Channel;

namespace {

// The place of a virtual operation in the table of its class, as the C++ ABI of both targets has
// it.
template <typename Function>
size_t SlotOf(Function function) {
    uintptr_t parts[2];
    static_assert(sizeof parts == sizeof function);
    memcpy(parts, &function, sizeof function);
    return (parts[0] - 1) / sizeof(void*);
}

class FlushFails : public Channel {
public:
    FlushFails() : Channel(16) {}
    int FlushWrite(int) override { return code; }
    int code = 0;
};

class ConnectedTcp {
public:
    explicit ConnectedTcp(Channel& channel) {
        port = listener.prepare(0);
        opened = channel.Open("127.0.0.1", port);
        fd = listener.accept();
    }
    ~ConnectedTcp() { close(fd); }
    ZEL::IPCListener listener;
    int port, opened, fd;
};

}  // namespace

TEST(Channel, OperationsKeepTheirSlots) {
    using C = Channel;
    size_t slot = 2;  // the destructor has the first two
    EXPECT_EQ(SlotOf(static_cast<int (C::*)(const char*)>(&C::Open)), slot++);
    EXPECT_EQ(SlotOf(static_cast<int (C::*)(int, bool)>(&C::Open)), slot++);
    EXPECT_EQ(SlotOf(static_cast<int (C::*)(const char*, int)>(&C::Open)), slot++);
    for (const size_t actual :
         {SlotOf(&C::Close),
          SlotOf(&C::SetTimeout),
          SlotOf(&C::SetFlag),
          SlotOf(&C::ConvertToSSLChannel),
          SlotOf(&C::ReadByte),
          SlotOf(&C::ReadInt16),
          SlotOf(&C::ReadInt32),
          SlotOf(&C::ReadInt64),
          SlotOf(&C::WriteByte),
          SlotOf(&C::WriteInt16),
          SlotOf(&C::WriteInt32),
          SlotOf(&C::WriteInt64),
          SlotOf(static_cast<int (C::*)(char*, unsigned int)>(&C::Read)),
          SlotOf(static_cast<int (C::*)(char*, unsigned int, unsigned int&)>(&C::Read)),
          SlotOf(&C::Write),
          SlotOf(&C::ClearRead),
          SlotOf(&C::ClearWrite),
          SlotOf(&C::FlushWrite),
          SlotOf(&C::GetPeerInfo),
          SlotOf(&C::IsClosed),
          SlotOf(&C::ReadMore),
          SlotOf(static_cast<unsigned long long (C::*)(unsigned long long)>(&C::Convert)),
          SlotOf(static_cast<unsigned int (C::*)(unsigned int)>(&C::Convert)),
          SlotOf(static_cast<unsigned short (C::*)(unsigned short)>(&C::Convert)),
          SlotOf(&C::CreateSock),
          SlotOf(&C::SetLinger),
          SlotOf(&C::SetNonBlock),
          SlotOf(&C::ConnectWithTimeout),
          SlotOf(&C::SwitchChannelOp)}) {
        EXPECT_EQ(actual, slot++);
    }
}

TEST(Channel, IntegersTravelMostSignificantByteFirst) {
    test::RawPeer peer;
    peer.channel.WriteByte(0xfe);
    peer.channel.WriteInt16(0x0102);
    peer.channel.WriteInt32(0x03040506);
    peer.channel.WriteInt64(0x0708090a0b0c0d0eULL);
    EXPECT_EQ(peer.Take(), "") << "sent before the flush";
    ASSERT_EQ(peer.channel.FlushWrite(0), 0);
    const std::string wire = peer.Take();
    EXPECT_EQ(test::Hex(wire), "fe 01 02 03 04 05 06 07 08 09 0a 0b 0c 0d 0e");
    peer.Send(wire);
    unsigned char byte = 0;
    unsigned short two = 0;
    unsigned int four = 0;
    unsigned long long eight = 0;
    ASSERT_EQ(peer.channel.ReadByte(&byte) | peer.channel.ReadInt16(&two) |
                  peer.channel.ReadInt32(&four) | peer.channel.ReadInt64(&eight),
              0);
    EXPECT_EQ(byte, 0xfe);
    EXPECT_EQ(two, 0x0102);
    EXPECT_EQ(four, 0x03040506U);
    EXPECT_EQ(eight, 0x0708090a0b0c0d0eULL);
}

TEST(Channel, BytesKeepTheirOrderThroughSmallRings) {
    for (const unsigned int capacity : {1U, 2U, 7U, 64U}) {
        test::RawPeer peer(capacity);
        std::string sent, echoed, received;
        for (unsigned int i = 0; i < 500; ++i) {
            const std::string block(i % (capacity + 1), static_cast<char>(i));
            ASSERT_EQ(peer.channel.Write(block.data(), static_cast<unsigned int>(block.size())), 0);
            sent += block;
            const std::string arrived = peer.Take();
            echoed += arrived;
            peer.Send(arrived);
            // Reads larger and smaller than the ring, never more than there is.
            std::string part(std::min<size_t>(echoed.size() - received.size(), i % (2 * capacity)),
                             0);
            ASSERT_EQ(peer.channel.Read(&part[0], static_cast<unsigned int>(part.size())), 0);
            received += part;
        }
        EXPECT_EQ(sent.compare(0, echoed.size(), echoed), 0);
        EXPECT_GE(echoed.size() + capacity, sent.size());
        EXPECT_EQ(echoed.compare(0, received.size(), received), 0);
        ASSERT_EQ(peer.channel.FlushWrite(0), 0);
        EXPECT_EQ(echoed + peer.Take(), sent);
    }
}

TEST(Channel, BytesKeepTheirOrderRoundTheEndOfTheRings) {
    // A socket that takes a part of each send makes the write ring go round.
    test::RawPeer peer(10007);
    const int size = 1;
    setsockopt(peer.channel_fd, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
    std::string sent, received;
    std::thread reader([&] {
        char buffer[700];
        for (ssize_t n; (n = read(peer.fd, buffer, sizeof buffer)) > 0;) {
            received.append(buffer, static_cast<size_t>(n));
        }
    });
    for (unsigned int i = 0; i < 3000; ++i) {
        const std::string block(i % 997, static_cast<char>(i));
        ASSERT_EQ(peer.channel.Write(block.data(), static_cast<unsigned int>(block.size())), 0);
        sent += block;
    }
    peer.channel.Close();
    reader.join();
    EXPECT_TRUE(received == sent);

    test::RawPeer ahead(8);
    char buffer[9] = "";
    ahead.Send("123456");
    ASSERT_EQ(ahead.channel.Read(buffer, 4), 0);
    ahead.Send("789abc");
    EXPECT_EQ(ahead.channel.ReadMore(6), 0);
    EXPECT_EQ(ahead.channel.ReadMore(1), ZEL::RESULT_INVALID_ARGUMENT) << "the ring is full";
    ASSERT_EQ(ahead.channel.Read(buffer, 8), 0);
    EXPECT_STREQ(buffer, "56789abc");
}

TEST(Channel, ABlockMayBeAsLargeAsTheRing) {
    test::RawPeer peer(8);
    EXPECT_EQ(peer.channel.Write("123456789", 9), ZEL::RESULT_INVALID_ARGUMENT);
    EXPECT_EQ(peer.channel.Write(nullptr, 1), ZEL::RESULT_INVALID_ARGUMENT);
    EXPECT_EQ(peer.channel.Read(nullptr, 1), ZEL::RESULT_INVALID_ARGUMENT);
    EXPECT_EQ(peer.channel.ReadInt32(nullptr), ZEL::RESULT_INVALID_ARGUMENT);
    EXPECT_EQ(peer.channel.Write("12345678", 8), 0);
    EXPECT_EQ(peer.channel.FlushWrite(0), 0);
    EXPECT_EQ(peer.Take(), "12345678");
    EXPECT_EQ(peer.channel.Write("lost", 4), 0);
    peer.channel.ClearWrite();
    peer.channel.Close();
    EXPECT_EQ(peer.Take(), "");
    EXPECT_EQ(peer.channel.Write("x", 1), ZEL::RESULT_IO);
}

TEST(Channel, TheEndOfTheStreamFailsTheReadAfterWhatHasArrived) {
    test::RawPeer peer;
    peer.Send("abc");
    peer.Close();
    char buffer[8] = "";
    unsigned int total = 99;
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    EXPECT_EQ(peer.channel.Read(buffer, 5, total), ZEL::RESULT_IO);
    EXPECT_EQ(total, 3U);
    EXPECT_STREQ(buffer, "abc");
    EXPECT_EQ(
        log.Text(),
        "[WARNING] ZEL/channel(N): read: Success\n"
        "[WARNING] ZEL/channel(N): Diagnose: select says the socket is readable but actually we "
        "can't read ... connection closed?\n");
}

TEST(Channel, APeerThatIsGoneFailsTheWriteAndRaisesNoSignal) {
    test::RawPeer peer;
    peer.Close();
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    peer.channel.Write("x", 1);
    EXPECT_EQ(peer.channel.FlushWrite(0), ZEL::RESULT_IO);
    peer.channel.Close();
    EXPECT_EQ(log.Text(),
              "[WARNING] ZEL/channel(N): write: Broken pipe\n"
              "[WARNING] ZEL/channel(N): write: Broken pipe\n"
              "[WARNING] ZEL/channel(N): FlushWrite: I/O error\n");
}

TEST(Channel, TimeOutsCountFromTheLastProgress) {
    test::RawPeer peer(4096);
    peer.channel.SetTimeout(1);
    const test::LogCapture log;
    unsigned char byte;
    EXPECT_EQ(peer.channel.ReadByte(&byte), ZEL::RESULT_TIMEOUT);
    EXPECT_THAT(log.Text(), AllOf(HasSubstr("select: timeout\n"),
                                  HasSubstr("ReadMore: Channel timeout for 1 seconed\n")));
    int result = 0;
    for (int i = 0; i < 10000 && result == 0; ++i) {
        result = peer.channel.Write(std::string(4096, 'x').data(), 4096);
    }
    EXPECT_EQ(result, ZEL::RESULT_TIMEOUT);
    EXPECT_THAT(log.Text(), HasSubstr("FlushWrite: Channel timeout for 1 seconds\n"
                                      "[WARNING] ZEL/channel(N): Write: FlushWrite failed\n"));
}

TEST(Channel, TheAbortFlagEndsAWaitWithoutLimit) {
    test::RawPeer peer;
    int flag = 0;
    peer.channel.SetFlag(&flag);
    peer.channel.SetTimeout(0);
    peer.channel.WriteByte(1);
    std::thread other([&flag] { __atomic_store_n(&flag, 1, __ATOMIC_RELAXED); });
    unsigned char byte;
    EXPECT_EQ(peer.channel.ReadByte(&byte), ZEL::RESULT_INTERRUPTED);
    other.join();
    EXPECT_EQ(peer.channel.FlushWrite(0), ZEL::RESULT_INTERRUPTED);
    EXPECT_EQ(peer.channel.ReadMore(0), 0);
}

TEST(Channel, ClosingTellsWhyTheLastFlushFailed) {
    const std::pair<int, const char*> cases[] = {
        {-1, "Interrupted"},     {-5, "Protocal error"},
        {-19, "no permission "}, {-25, "permission is read-only"},
        {-26, "Unknown error"},  {INT_MIN, "Unknown error"}};
    for (const auto& [code, text] : cases) {
        int fds[2];
        ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
        FlushFails channel;
        ASSERT_EQ(channel.Open(fds[0], false), 0);
        channel.code = code;
        const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
        channel.Close();
        EXPECT_EQ(log.Text(), std::string("[WARNING] ZEL/channel(N): FlushWrite: ") + text + "\n");
        EXPECT_TRUE(channel.IsClosed());
        close(fds[1]);
    }
}

TEST(Channel, OpensOnlyWhatCanBeOpened) {
    test::RawPeer peer;
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    EXPECT_EQ(peer.channel.Open(peer.fd, true), -4);
    EXPECT_THAT(log.Text(), EndsWith("]\n[WARNING] ZEL/channel(N): Open: Invalid argument\n"));
    Channel channel(16);
    EXPECT_EQ(channel.Open(-1, false), -4);
    EXPECT_EQ(channel.Open(-1, true), -3);
    EXPECT_THAT(log.Text(), EndsWith("[WARNING] ZEL/channel(N): setsockopt: Bad file descriptor\n"
                                     "[WARNING] ZEL/channel(N): Open: SetLinger to socket [-1] "
                                     "failed, Bad file descriptor\n"));
    EXPECT_EQ(channel.Open("/nowhere/at all"), -2);
    EXPECT_THAT(log.Text(),
                EndsWith("Channel: Can not connect to server at '/nowhere/at all'. No such "
                         "file or directory\n"));
    EXPECT_EQ(channel.Open(nullptr, 80), 0);
    EXPECT_EQ(channel.Open("127.0.0.1", -1), 0);
    EXPECT_EQ(channel.ConnectWithTimeout(-1, "127.0.0.1", 1), -4);
    EXPECT_THAT(log.Text(), EndsWith("Invalid argumants (ip: 127.0.0.1, port: 1\n"));
    EXPECT_EQ(channel.Open("127.0.0.1", 65536 + 22), -2);
    EXPECT_EQ(channel.Open("255.255.255.255", 1), -2);
    EXPECT_THAT(log.Text(), EndsWith("connect: Network is unreachable (101)\n"));
    std::string ip = "old";
    int port = 0;
    EXPECT_EQ(channel.GetPeerInfo(ip, port), -1);
    EXPECT_EQ(ip, "");
    EXPECT_EQ(peer.channel.GetPeerInfo(ip, port), -1) << "a unix socket has no IPv4 address";
    EXPECT_TRUE(channel.IsClosed());
}

TEST(Channel, ANewConnectionClosesTheOldOne) {
    test::RawPeer peer;
    const ConnectedTcp tcp(peer.channel);
    ASSERT_EQ(tcp.opened, 0);
    EXPECT_TRUE(peer.SeesEnd());
    std::string ip;
    int port = 0;
    EXPECT_EQ(peer.channel.GetPeerInfo(ip, port), 0);
    EXPECT_EQ(ip, "127.0.0.1");
    EXPECT_EQ(port, tcp.port);
}

TEST(Channel, UrgentDataIsAnException) {
    Channel channel(16);
    const ConnectedTcp tcp(channel);
    ASSERT_EQ(send(tcp.fd, "!", 1, MSG_OOB), 1);
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    unsigned char byte;
    EXPECT_EQ(channel.ReadByte(&byte), ZEL::RESULT_IO);
    EXPECT_EQ(log.Text(), "[WARNING] ZEL/channel(N): ReadFd: exception set\n");
}

TEST(Channel, DescriptorsAboveAThousandWork) {
    rlimit limit = {};
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    const int high = fcntl(fds[0], F_DUPFD, 1500);
    ASSERT_GE(high, 1500);
    close(fds[0]);
    Channel channel(16);
    ASSERT_EQ(channel.Open(high, true), 0);
    ASSERT_EQ(write(fds[1], "x", 1), 1);
    unsigned char byte = 0;
    EXPECT_EQ(channel.ReadByte(&byte), 0);
    EXPECT_EQ(byte, 'x');
    close(fds[1]);
}

TEST(CertName, AWildcardCoversOneLabelAndTheParent) {
    using std::string_literals::operator""s;
    const struct {
        std::string name, host;
        bool covers;
    } cases[] = {
        {"nas.example", "nas.example", true},
        {"NAS.Example", "nas.eXAMPLE", true},
        {"nas.example", "nas.example.", false},
        {"", "nas.example", false},
        {"*", "nas", false},
        {"*.x.y", "a.x.y", true},
        {"*.X.y", "A.x.Y", true},
        {"*.x.y", "x.y", true},
        {"*.x.y", "a.b.x.y", false},
        {"*.x.y", ".x.y", true},
        {"*.x.y", "ax.y", false},
        {"*-x.y", "a.x.y", true},
        {"a*.x.y", "ab.x.y", false},
        {"*.", "host.", true},
        {"nas.example\0.evil"s, "nas.example", false},
        {"*.x\0.y"s, "a.x", false},
        {"\xc3\x84.x", "\xc3\xa4.x", false},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(ZEL::CertNameCovers(c.name, c.host), c.covers) << c.name << " / " << c.host;
    }
}

TEST(Channel, TlsFilesHaveTheirDefaultsBelowTheRootUntilTheyAreSet) {
    const test::TempRoot root;
    EXPECT_EQ(Channel::GetCertPath(), root.Path("tmp/.cloud_certs"));
    EXPECT_EQ(Channel::GetKeyPath(), root.Path("tmp/.cloud_server.key"));
    EXPECT_EQ(Channel::GetCAPath(), root.Path("certs.pem"));
    Channel::SetVerifyCAPath("/other.pem");
    EXPECT_EQ(Channel::GetCAPath(), "/other.pem");
    EXPECT_TRUE(Channel(16).IsAllowingUntrust());
}

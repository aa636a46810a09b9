#include "ZEL/channel.h"

#include <sys/resource.h>

#include "ZEL/internal/cert_name.h"
#include "ZEL/internal/channel_socket.h"
#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "tests/support/log_capture.h"
#include "tests/support/sockets.h"
#include "tests/support/testing.h"

using namespace testing;
using ZEL::Channel;

namespace {

// The place of a virtual operation in its class's table, as the C++ ABI of both targets has it.
template <typename Function>
size_t SlotOf(Function function) {
    uintptr_t parts[2];
    static_assert(sizeof parts == sizeof function);
    memcpy(parts, &function, sizeof function);
    return (parts[0] - 1) / sizeof(void*);
}

}  // namespace

TEST(Channel, OperationsKeepTheirSlots) {
    using C = Channel;
    EXPECT_EQ(SlotOf(static_cast<int (C::*)(int, bool)>(&C::Open)), 3U);
    EXPECT_EQ(SlotOf(&C::ConvertToSSLChannel), 8U);
    EXPECT_EQ(SlotOf(static_cast<int (C::*)(char*, unsigned int)>(&C::Read)), 17U);
    EXPECT_EQ(SlotOf(&C::ReadMore), 25U);
    EXPECT_EQ(SlotOf(static_cast<unsigned int (C::*)(unsigned int)>(&C::Convert)), 27U);
    EXPECT_EQ(SlotOf(&C::SwitchChannelOp), 33U);
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
    peer.Send(wire.substr(1));
    unsigned short two = 0;
    unsigned int four = 0;
    unsigned long long eight = 0;
    ASSERT_EQ(peer.channel.ReadInt16(&two), 0);
    ASSERT_EQ(peer.channel.ReadInt32(&four), 0);
    ASSERT_EQ(peer.channel.ReadInt64(&eight), 0);
    EXPECT_EQ(two, 0x0102);
    EXPECT_EQ(four, 0x03040506U);
    EXPECT_EQ(eight, 0x0708090a0b0c0d0eULL);
}

TEST(Channel, BytesKeepTheirOrderRoundTheEndOfTheRings) {
    // A socket that takes a part of each send makes the write ring go round.
    test::RawPeer peer(10007);
    const int size = 1;
    setsockopt(peer.channel_fd, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
    std::string sent, received;
    std::thread reader([&] { received = peer.Take(0); });
    for (unsigned int i = 0; i < 3000; ++i) {
        const std::string block(i % 997, static_cast<char>(i));
        ASSERT_EQ(peer.channel.Write(block.data(), i % 997), 0);
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

TEST(Channel, LargeReadsTakeWhatWasReadAheadFirstAndTellWhatCame) {
    std::string sent;
    for (int i = 0; i < 100000; ++i) {
        sent += static_cast<char>(i * 31 >> 3);
    }
    for (const unsigned int first : {1U, 70000U}) {
        test::RawPeer peer(30000);
        std::thread writer([&] {
            peer.Send(sent);
            shutdown(peer.fd, SHUT_WR);
        });
        std::string received(sent.size() + 20000, ' ');
        EXPECT_EQ(peer.channel.Read(received.data(), first), 0);
        unsigned int total = 0;
        EXPECT_EQ(peer.channel.Read(&received[first], 120000 - first, total), ZEL::RESULT_IO);
        writer.join();
        EXPECT_EQ(first + total, sent.size());
        EXPECT_TRUE(received.compare(0, sent.size(), sent) == 0);
    }
}

TEST(Channel, ABlockMayBeAsLargeAsTheRing) {
    test::RawPeer peer(8);
    EXPECT_EQ(peer.channel.Write("123456789", 9), ZEL::RESULT_INVALID_ARGUMENT);
    EXPECT_EQ(peer.channel.Write(nullptr, 1), ZEL::RESULT_INVALID_ARGUMENT);
    EXPECT_EQ(peer.channel.Write("12345678", 8), 0);
    EXPECT_EQ(peer.channel.FlushWrite(0), 0);
    EXPECT_EQ(peer.channel.Write("lost", 4), 0);
    peer.channel.ClearWrite();
    peer.channel.Close();
    EXPECT_EQ(peer.Take(), "12345678");
    EXPECT_EQ(peer.channel.Write("x", 1), ZEL::RESULT_IO);
}

TEST(Channel, APeerThatIsGoneFailsReadsAfterWhatHasArrivedAndWritesWithoutASignal) {
    test::RawPeer peer;
    peer.Send("abc");
    peer.Close();
    char buffer[8] = "";
    unsigned int total = 99;
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    EXPECT_EQ(peer.channel.Read(buffer, 5, total), ZEL::RESULT_IO);
    EXPECT_EQ(total, 3U);
    EXPECT_STREQ(buffer, "abc");
    peer.channel.Write("x", 1);
    EXPECT_EQ(peer.channel.FlushWrite(0), ZEL::RESULT_IO);
    EXPECT_THAT(log.Text(), HasSubstr("actually we can't read ... connection closed?\n"
                                      "[WARNING] ZEL/channel(N): write: Broken pipe\n"));
}

TEST(Channel, AWaitEndsAtItsTimeOutOrWhenTheAbortFlagIsSet) {
    test::RawPeer peer(4096);
    peer.channel.SetTimeout(1);
    const test::LogCapture log;
    unsigned char byte;
    EXPECT_EQ(peer.channel.ReadByte(&byte), ZEL::RESULT_TIMEOUT);
    int result = 0;
    for (int i = 0; i < 10000 && result == 0; ++i) {
        result = peer.channel.Write(std::string(4096, 'x').data(), 4096);
    }
    EXPECT_EQ(result, ZEL::RESULT_TIMEOUT);
    EXPECT_THAT(log.Text(), AllOf(HasSubstr("ReadMore: Channel timeout for 1 seconed\n"),
                                  HasSubstr("FlushWrite: Channel timeout for 1 seconds\n")));
    int flag = 0;
    peer.channel.SetFlag(&flag);
    peer.channel.SetTimeout(0);
    std::thread other([&flag] { __atomic_store_n(&flag, 1, __ATOMIC_RELAXED); });
    EXPECT_EQ(peer.channel.ReadByte(&byte), ZEL::RESULT_INTERRUPTED);
    other.join();
    EXPECT_EQ(peer.channel.FlushWrite(0), ZEL::RESULT_INTERRUPTED);
}

TEST(Channel, OpensOnlyWhatCanBeOpened) {
    test::RawPeer peer;
    EXPECT_EQ(peer.channel.Open(peer.fd, true), -4) << "it is open";
    Channel channel(16);
    EXPECT_EQ(channel.Open(-1, false), -4);
    EXPECT_EQ(channel.Open(-1, true), -3);
    EXPECT_EQ(channel.Open("/nowhere/at all"), -2);
    EXPECT_EQ(channel.Open(nullptr, 80), 0);
    EXPECT_EQ(channel.Open("127.0.0.1", -1), 0);
    EXPECT_EQ(channel.ConnectWithTimeout(-1, "127.0.0.1", 1), -4);
    EXPECT_EQ(channel.Open("127.0.0.1", 65536 + 22), -2);
    std::string ip = "old";
    int port = 0;
    EXPECT_EQ(channel.GetPeerInfo(ip, port), -1);
    EXPECT_EQ(ip, "");
    EXPECT_EQ(peer.channel.GetPeerInfo(ip, port), -1) << "a unix socket has no IPv4 address";
}

TEST(Channel, ANewConnectionClosesTheOldOneAndUrgentDataEndsItsReads) {
    test::RawPeer peer;
    ZEL::IPCListener listener;
    const int listened = listener.prepare(0);
    ASSERT_EQ(peer.channel.Open("127.0.0.1", listened), 0);
    EXPECT_EQ(peer.Take(0), "");
    std::string ip;
    int port = 0;
    EXPECT_EQ(peer.channel.GetPeerInfo(ip, port), 0);
    EXPECT_EQ(std::pair(ip, port), std::pair(std::string("127.0.0.1"), listened));
    const int fd = listener.accept();
    ASSERT_EQ(send(fd, "!", 1, MSG_OOB), 1);
    unsigned char byte;
    EXPECT_EQ(peer.channel.ReadByte(&byte), ZEL::RESULT_IO);
    close(fd);
}

TEST(Channel, ASendBufferIsNeverMadeSmaller) {
    const auto buffer_of = [](int fd) {
        int bytes = 0;
        socklen_t size = sizeof bytes;
        getsockopt(fd, SOL_SOCKET, SO_SNDBUF, &bytes, &size);
        return bytes;
    };
    for (const unsigned int capacity : {64U, 0x14000U, 1U << 30}) {
        const test::RawPeer peer;
        const int before = buffer_of(peer.channel_fd);
        Channel channel(capacity);
        ASSERT_EQ(channel.Open(dup(peer.channel_fd), true), 0);
        EXPECT_GE(buffer_of(peer.channel_fd), before) << capacity;
    }
}

TEST(Channel, DescriptorsAboveAThousandWork) {
    rlimit limit = {};
    getrlimit(RLIMIT_NOFILE, &limit);
    limit.rlim_cur = limit.rlim_max;
    setrlimit(RLIMIT_NOFILE, &limit);
    const test::RawPeer peer;
    Channel channel(16);
    const int high = fcntl(peer.channel_fd, F_DUPFD, 1500);
    ASSERT_GE(high, 1500);
    ASSERT_EQ(channel.Open(high, true), 0);
    peer.Send("x");
    unsigned char byte = 0;
    EXPECT_EQ(channel.ReadByte(&byte), 0);
    EXPECT_EQ(byte, 'x');
}

TEST(CertName, AWildcardCoversOneLabelAndTheParent) {
    using std::string_literals::operator""s;
    const struct {
        std::string name, host;
        bool covers;
    } cases[] = {
        {"NAS.Example", "nas.eXAMPLE", true},
        {"nas.example", "nas.example.", false},
        {"", "nas.example", false},
        {"*", "nas", false},
        {"*.X.y", "A.x.Y", true},
        {"*.x.y", "x.y", true},
        {"*.x.y", "a.b.x.y", false},
        {"*.x.y", "ax.y", false},
        {"*-x.y", "a.x.y", true},
        {"a*.x.y", "ab.x.y", false},
        {"nas.example\0.evil"s, "nas.example", false},
        {"*.x\0.y"s, "a.x", false},
    };
    for (const auto& c : cases) {
        EXPECT_EQ(ZEL::CertNameCovers(c.name, c.host), c.covers) << c.name << " / " << c.host;
    }
}

TEST(Channel, TlsFilesHaveTheirDefaultsBelowTheRoot) {
    const test::TempRoot root;
    EXPECT_EQ(Channel::GetCertPath(), root.Path("tmp/.cloud_certs"));
    EXPECT_EQ(Channel::GetKeyPath(), root.Path("tmp/.cloud_server.key"));
    EXPECT_EQ(Channel::GetCAPath(), root.Path("certs.pem"));
    EXPECT_TRUE(Channel(16).IsAllowingUntrust());
}

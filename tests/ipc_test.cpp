#include "ZEL/ipc.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <thread>

#include "ZEL/log.h"
#include "tests/support/log_capture.h"

using testing::HasSubstr;
using ZEL::IPCListener;
using ZEL::IPCSender;
using ZEL::PObject;

namespace {

constexpr timeval kNoWait = {0, 0};

// Answers one request with {"echo": request}.
void AnswerOne(IPCListener& listener) {
    IPCSender peer;
    PObject request, reply;
    if (listener.isReady() && peer.assign(listener.accept()) == 0 && peer.recv(request) == 0) {
        reply["echo"] = request;
        peer.send(reply);
    }
}

void ExpectEcho(IPCListener& listener, IPCSender& sender) {
    std::thread server([&listener] { AnswerOne(listener); });
    PObject request, reply;
    request["n"] = 7;
    EXPECT_EQ(sender.send(request, true, reply), 0);
    EXPECT_EQ(reply.toString(), "{\"echo\": {\"n\": 7}}");
    server.join();
    EXPECT_EQ(sender.send(request, true, reply), -1) << "the peer has closed";
    sender.close();
    EXPECT_EQ(sender.send(request), -1);
}

bool Exists(const std::string& path) {
    struct stat info = {};
    return lstat(path.c_str(), &info) == 0;
}

}  // namespace

TEST(Ipc, RequestsAreAnsweredOverAPathAndOverAPort) {
    const test::TempFolder folder;
    IPCListener listener;
    EXPECT_FALSE(listener.isReady());
    EXPECT_EQ(listener.accept(), -1);
    ASSERT_EQ(listener.prepare(folder.Path("socket")), 0);
    EXPECT_EQ(listener.prepare(folder.Path("second")), -1) << "it listens already";
    IPCSender sender;
    EXPECT_EQ(sender.connect(folder.Path("none")), -1);
    EXPECT_EQ(sender.assign(-1), -1);
    ASSERT_EQ(sender.connect(folder.Path("socket")), 0);
    ExpectEcho(listener, sender);

    const int port = listener.prepare(0);
    ASSERT_GT(port, 0);
    EXPECT_FALSE(Exists(folder.Path("socket"))) << "the old socket file is gone";
    EXPECT_EQ(sender.connect(-1), -1);
    ASSERT_EQ(sender.connect(port), 0);
    ExpectEcho(listener, sender);
    listener.setTimeout(kNoWait);
    EXPECT_FALSE(listener.isReady());
}

TEST(Ipc, ASocketFileIsReplacedAndRemoved) {
    const test::TempFolder folder;
    const std::string path = folder.Write("socket", "left from an earlier run");
    {
        IPCListener listener;
        ASSERT_EQ(listener.prepare(path), 0);
        EXPECT_EQ(fcntl(listener.getFD(), F_GETFD), FD_CLOEXEC);
        IPCSender sender;
        EXPECT_EQ(sender.connect(path), 0);
    }
    EXPECT_FALSE(Exists(path));
    IPCListener listener;
    const test::LogCapture log(ZEL::Logger::LEVEL_ERROR);
    EXPECT_EQ(listener.prepare(folder.Path("no/such/folder")), -1);
    EXPECT_EQ(log.Text(), "[ERROR] ZEL/ipc(N): bind: No such file or directory (2)\n");
    EXPECT_EQ(listener.getFD(), -1);
    EXPECT_EQ(listener.OpenDomainSocket(""), -1);
    EXPECT_EQ(listener.CloseDomainSocket(-1), -1);
    // The longest path fills the address and has no terminator in it.
    const std::string longest = folder.Path(std::string(107 - folder.Path().size(), 'x'));
    ASSERT_EQ(longest.size(), 108U);
    EXPECT_EQ(listener.prepare(longest), 0);
    EXPECT_TRUE(Exists(longest));
    listener.close();
    EXPECT_FALSE(Exists(longest));
}

TEST(Ipc, APortThatIsTakenGivesTheNextFreeOne) {
    // Two neighbours below a free port are needed, which anybody may take meanwhile: the search for
    // them is repeated.
    for (int base = 20000; base < 60000; base += 97) {
        IPCListener first, second, listener;
        if (first.prepare(base) != base || second.prepare(base + 1) != base + 1) {
            continue;
        }
        const test::LogCapture log(ZEL::Logger::LEVEL_INFO);
        const int port = listener.prepare(base);
        ASSERT_GT(port, base + 1);
        if (port != base + 2) {
            continue;
        }
        const std::string b = std::to_string(base);
        const std::string next = std::to_string(base + 1);
        const std::string free = std::to_string(base + 2);
        const std::string taken = "[ERROR] ZEL/ipc(N): bind: Address already in use (98)\n";
        EXPECT_EQ(log.Text(), "[INFO] ZEL/ipc(N): Try to bind port: " + b + "\n" + taken +
                                  "[INFO] ZEL/ipc(N): Bind port " + b + " failed, try next one\n" +
                                  "[INFO] ZEL/ipc(N): Try to bind port: " + next + "\n" + taken +
                                  "[INFO] ZEL/ipc(N): Bind port " + next +
                                  " failed, try next one\n" +
                                  "[INFO] ZEL/ipc(N): Try to bind port: " + free + "\n" +
                                  "[INFO] ZEL/ipc(N): Bind port " + free + " success\n" +
                                  "[INFO] ZEL/ipc(N): listening on port " + free + "\n");
        EXPECT_EQ(listener.OpenSocket(base), -1);
        sockaddr_in address = {};
        socklen_t size = sizeof address;
        ASSERT_EQ(getsockname(listener.getFD(), reinterpret_cast<sockaddr*>(&address), &size), 0);
        EXPECT_EQ(address.sin_addr.s_addr, htonl(INADDR_LOOPBACK))
            << "nobody else's host may connect";
        return;
    }
    FAIL() << "no three neighbouring ports are free";
}

TEST(Ipc, TheSearchEndsAfterTheLastPort) {
    IPCListener last, listener;
    const int port = last.prepare(65535);
    ASSERT_TRUE(port == 65535 || port == -1);
    const test::LogCapture log(ZEL::Logger::LEVEL_INFO);
    EXPECT_EQ(listener.prepare(65535), -1);
    EXPECT_THAT(log.Text(), HasSubstr("Try to bind port: 65536\n"
                                      "[ERROR] ZEL/ipc(N): Port number exceeds 65536\n"
                                      "[ERROR] ZEL/ipc(N): find available port failed\n"));
    EXPECT_EQ(listener.getFD(), -1);
    EXPECT_EQ(listener.prepare(-1), -1);
    EXPECT_EQ(listener.OpenSocket(0), -1);
    EXPECT_EQ(listener.OpenSocket(65536), -1);
    EXPECT_EQ(listener.CloseSocket(-1), -1);
}

#include "ZEL/ipc.h"

#include <arpa/inet.h>

#include "ZEL/log.h"
#include "tests/support/log_capture.h"
#include "tests/support/testing.h"

using namespace testing;
using ZEL::IPCListener;
using ZEL::IPCSender;

TEST(Ipc, ListensAtAPathOrOnAPort) {
    const test::TempFolder folder;
    IPCListener listener;
    EXPECT_FALSE(listener.isReady());
    EXPECT_EQ(listener.accept(), -1);
    const std::string path = folder.Write("socket", "left from an earlier run");
    ASSERT_EQ(listener.prepare(path), 0);
    EXPECT_EQ(fcntl(listener.getFD(), F_GETFD), FD_CLOEXEC);
    EXPECT_EQ(listener.prepare(folder.Path("second")), -1) << "it listens already";
    IPCSender sender;
    EXPECT_EQ(sender.connect(folder.Path("none")), -1);
    EXPECT_EQ(sender.assign(-1), -1);
    ASSERT_EQ(sender.connect(path), 0);
    EXPECT_TRUE(listener.isReady());
    sender.close();

    const int port = listener.prepare(0);
    ASSERT_GT(port, 0);
    EXPECT_NE(access(path.c_str(), F_OK), 0) << "the old socket file is gone";
    EXPECT_EQ(sender.connect(-1), -1);
    EXPECT_EQ(sender.connect(port), 0);
    close(listener.accept());
    listener.setTimeout({0, 0});
    EXPECT_FALSE(listener.isReady());
    listener.close();
    EXPECT_EQ(listener.prepare(folder.Path("no/such/folder")), -1);
    // The longest path fills the address and has no terminator in it.
    const std::string longest = folder.Path(std::string(107 - folder.Path().size(), 'x'));
    ASSERT_EQ(listener.prepare(longest), 0);
    EXPECT_EQ(access(longest.c_str(), F_OK), 0);
    listener.close();
    EXPECT_NE(access(longest.c_str(), F_OK), 0);
}

TEST(Ipc, APortThatIsTakenGivesTheNextFreeOne) {
    // One port is taken; anybody may hold the next, so that the search for the two is repeated.
    for (int base = 20000; base < 60000; base += 97) {
        IPCListener first, listener;
        const test::LogCapture log(ZEL::Logger::LEVEL_INFO);
        if (first.prepare(base) != base || listener.prepare(base) != base + 1) {
            continue;
        }
        const std::string taken = std::to_string(base);
        EXPECT_THAT(log.Text(), HasSubstr("[ERROR] ZEL/ipc(N): bind: Address already in use (98)\n"
                                          "[INFO] ZEL/ipc(N): Bind port " +
                                          taken + " failed, try next one\n"));
        sockaddr_in address = {};
        socklen_t size = sizeof address;
        ASSERT_EQ(getsockname(listener.getFD(), reinterpret_cast<sockaddr*>(&address), &size), 0);
        EXPECT_EQ(address.sin_addr.s_addr, htonl(INADDR_LOOPBACK)) << "for this host only";
        return;
    }
    FAIL() << "no two neighbouring ports are free";
}

TEST(Ipc, TheSearchEndsAfterTheLastPort) {
    IPCListener last, listener;
    const int port = last.prepare(65535);
    ASSERT_TRUE(port == 65535 || port == -1);
    const test::LogCapture log(ZEL::Logger::LEVEL_ERROR);
    EXPECT_EQ(listener.prepare(65535), -1);
    EXPECT_THAT(log.Text(), HasSubstr("[ERROR] ZEL/ipc(N): Port number exceeds 65536\n"
                                      "[ERROR] ZEL/ipc(N): find available port failed\n"));
    EXPECT_EQ(listener.prepare(-1), -1);
    EXPECT_EQ(listener.OpenSocket(65536), -1);
}

// Many clients against one listener, and a transfer that another thread watches.

#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "ZEL/stream.h"
#include "tests/support/sockets.h"
#include "tests/support/testing.h"

using ZEL::IPCListener;
using ZEL::IPCSender;
using ZEL::PObject;

namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr int kRequests = 100;
#else
constexpr int kRequests = 10000;
#endif
constexpr int kClients = 64;
constexpr int kTransfers = 500;

void Ask(const std::string& path, int client) {
    IPCSender sender;
    ASSERT_EQ(sender.connect(path), 0);
    PObject request;
    request["padding"] = std::string(static_cast<size_t>(client) * 4, 'p');
    for (int i = 0; i < kRequests; ++i) {
        // Throughout the run, somebody dies in the middle of a request.
        if (i == kRequests / kClients * client) {
            ZEL::Channel channel(100);
            ASSERT_EQ(channel.Open(path.c_str()), 0);
            // A map, a key, and half an integer.
            const std::string half = test::Unhex("42 10 00 01 6b 01 08 00 00");
            channel.Write(half.data(), static_cast<unsigned int>(half.size()));
        }
        request["list"].asArray().assign(3, PObject(i));
        PObject reply;
        ASSERT_EQ(sender.send(request, true, reply), 0);
        ASSERT_EQ(reply["request"].toString(), request.toString());
    }
}

void Serve(int fd, std::atomic<int>& answered) {
    IPCSender peer;
    ASSERT_EQ(peer.assign(fd), 0);
    for (PObject request, reply; peer.recv(request) == 0; request = PObject()) {
        reply["request"] = request;
        answered += peer.send(reply) == 0 ? 1 : 0;
    }
}

}  // namespace

TEST(Stress, EveryRequestOfEveryClientIsAnswered) {
    const test::TempFolder folder;
    // Broken connections are told to the log, once per dying client: not to the machine's.
    ZEL::Logger::Initialize(ZEL::Logger::LOGFILE, ZEL::Logger::LEVEL_ERROR, folder.Path("log"), 2);
    IPCListener listener;
    ASSERT_EQ(listener.prepare(folder.Path("socket")), 0);
    std::atomic<int> answered{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < kClients; ++i) {
        threads.emplace_back(Ask, folder.Path("socket"), i);
    }
    for (int i = 0; i < 2 * kClients; ++i) {
        while (!listener.isReady()) {
        }
        threads.emplace_back(Serve, listener.accept(), std::ref(answered));
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(answered, kClients * kRequests);
    ZEL::Logger::Destroy();
}

TEST(Stress, AnotherThreadCanWatchATransfer) {
    test::RawPeer peer;
    ZEL::Channel far_end(4096);
    ASSERT_EQ(far_end.Open(std::exchange(peer.fd, -1), true), 0);
    const std::string key = "a key that is longer than a string holds by itself";
    PObject value;
    value["outer"][key].asArray().assign(100, PObject(7));
    ZEL::PStream sending, receiving;
    std::atomic<bool> done{false};
    std::thread watcher([&] {
        while (!done) {
            for (ZEL::PStream* stream : {&sending, &receiving}) {
                std::string path;
                unsigned long long moved = 1, total = 1;
                stream->GetStatus(path, moved, total);
                EXPECT_TRUE(path.empty() || path == "outer" || path == "outer." + key) << path;
            }
        }
    });
    std::thread sender([&] {
        for (int i = 0; i < kTransfers; ++i) {
            ASSERT_EQ(sending.Send(peer.channel, value), 0);
        }
    });
    for (int i = 0; i < kTransfers; ++i) {
        PObject received;
        ASSERT_EQ(receiving.Recv(far_end, received), 0);
        ASSERT_EQ(received.toString(), value.toString());
    }
    sender.join();
    done = true;
    watcher.join();
}

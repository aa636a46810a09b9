// Many clients against one listener, and a transfer that another thread watches.
#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "ZEL/stream.h"
#include "tests/support/sockets.h"
#include "tests/support/temp_root.h"

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
constexpr int kWatchedTransfers = 500;

bool DiesEarly(int client) {
    return client % 8 == 0;
}

// A client that dies does so in the middle of a request, after a tenth of the others' number.
int Requests(int client) {
    return DiesEarly(client) ? kRequests / 10 : kRequests;
}

void Ask(const std::string& path, int client) {
    IPCSender sender;
    ASSERT_EQ(sender.connect(path), 0);
    PObject request;
    request["client"] = client;
    request["padding"] = std::string(static_cast<size_t>(client) * 4, 'p');
    for (int i = 0; i < Requests(client); ++i) {
        request["list"].asArray().assign(3, PObject(i));
        PObject reply;
        ASSERT_EQ(sender.send(request, true, reply), 0);
        ASSERT_EQ(reply["request"].toString(), request.toString());
    }
    if (DiesEarly(client)) {
        sender.close();
        ZEL::Channel channel(100);
        ASSERT_EQ(channel.Open(path.c_str()), 0);
        // A map, a key, and half an integer.
        const std::string half = test::Unhex("42 10 00 01 6b 01 08 00 00");
        channel.Write(half.data(), static_cast<unsigned int>(half.size()));
    }
}

void Serve(int fd, std::atomic<int>& answered) {
    IPCSender peer;
    ASSERT_EQ(peer.assign(fd), 0);
    for (;;) {
        PObject request, reply;
        if (peer.recv(request) != 0) {
            return;
        }
        reply["request"] = request;
        if (peer.send(reply) == 0) {
            ++answered;
        }
    }
}

}  // namespace

TEST(Stress, EveryRequestOfEveryClientIsAnswered) {
    const test::TempFolder folder;
    const std::string path = folder.Path("socket");
    // Broken connections are told to the log, once per dying client: not to the machine's.
    ZEL::Logger::Initialize(ZEL::Logger::LOGFILE, ZEL::Logger::LEVEL_ERROR, folder.Path("log"), 2);
    IPCListener listener;
    ASSERT_EQ(listener.prepare(path), 0);
    std::atomic<int> answered{0};
    int expected = 0;
    int connections = kClients;
    std::vector<std::thread> clients, servers;
    for (int i = 0; i < kClients; ++i) {
        expected += Requests(i);
        connections += DiesEarly(i) ? 1 : 0;
        clients.emplace_back(Ask, path, i);
    }
    for (int i = 0; i < connections; ++i) {
        while (!listener.isReady()) {
        }
        servers.emplace_back(Serve, listener.accept(), std::ref(answered));
    }
    for (std::vector<std::thread>* threads : {&clients, &servers}) {
        for (std::thread& thread : *threads) {
            thread.join();
        }
    }
    EXPECT_EQ(answered, expected);
    ZEL::Logger::Destroy();
}

TEST(Stress, AnotherThreadCanWatchATransfer) {
    test::RawPeer peer;
    ZEL::Channel far_end(4096);
    ASSERT_EQ(far_end.Open(std::exchange(peer.fd, -1), true), 0);
    PObject value;
    for (int i = 0; i < 100; ++i) {
        value["outer"]["a key that is longer than a string holds by itself"].asArray().push_back(i);
    }
    ZEL::PStream sending, receiving;
    std::atomic<bool> done{false};
    std::thread watcher([&] {
        const std::string inner = "outer.a key that is longer than a string holds by itself";
        while (!done) {
            for (ZEL::PStream* stream : {&sending, &receiving}) {
                std::string path;
                unsigned long long moved = 1;
                unsigned long long total = 1;
                stream->GetStatus(path, moved, total);
                EXPECT_TRUE(path.empty() || path == "outer" || path == inner) << path;
            }
        }
    });
    std::thread sender([&] {
        for (int i = 0; i < kWatchedTransfers; ++i) {
            ASSERT_EQ(sending.Send(peer.channel, value), 0);
        }
    });
    for (int i = 0; i < kWatchedTransfers; ++i) {
        PObject received;
        ASSERT_EQ(receiving.Recv(far_end, received), 0);
        ASSERT_EQ(received.toString(), value.toString());
    }
    sender.join();
    done = true;
    watcher.join();
}

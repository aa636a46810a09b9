// The message layers beside the bare socket, in one run: build/bench/bin/messages_bench
//
// The peer of each message line moves the same bytes over the same kind of socket with bare write()
// and read(), a write a message. The best of some rounds counts, ours and the peer's in turn: the
// machine has other work too.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "ZEL/stream.h"

namespace {

using ZEL::PObject;

constexpr int kRounds = 5;
constexpr unsigned int kCapacity = 81920;  // of IPCSender's channel; the peer reads by as much

void Require(bool holds, const char* what) {
    if (!holds) {
        fprintf(stderr, "%s failed\n", what);
        exit(1);
    }
}

// Both ends of a connection, closed by whoever takes them.
struct Connection {
    explicit Connection(bool tcp) {
        if (!tcp) {
            Require(socketpair(AF_UNIX, SOCK_STREAM, 0, fds) == 0, "socketpair");
            return;
        }
        ZEL::IPCListener listener;
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        address.sin_port = htons(static_cast<uint16_t>(listener.prepare(0)));
        fds[0] = socket(AF_INET, SOCK_STREAM, 0);
        Require(connect(fds[0], reinterpret_cast<sockaddr*>(&address), sizeof address) == 0,
                "connect");
        fds[1] = listener.accept();
    }
    int fds[2];
};

class BarePeer {
public:
    BarePeer(int fd, size_t message_size)
        : fd_(fd), message_(message_size, 'x'), buffer_(kCapacity) {}
    ~BarePeer() { close(fd_); }
    BarePeer(const BarePeer&) = delete;
    BarePeer& operator=(const BarePeer&) = delete;
    void Send() {
        for (size_t done = 0; done < message_.size();) {
            const ssize_t n = write(fd_, &message_[done], message_.size() - done);
            Require(n > 0, "write");
            done += static_cast<size_t>(n);
        }
    }
    void Recv() {
        while (held_ < message_.size()) {
            const ssize_t n = read(fd_, buffer_.data(), buffer_.size());
            Require(n > 0, "read");
            held_ += static_cast<size_t>(n);
        }
        held_ -= message_.size();
    }

private:
    int fd_;
    std::string message_;
    std::vector<char> buffer_;
    size_t held_ = 0;
};

class MessagePeer {
public:
    MessagePeer(int fd, const PObject& message) : message_(message) {
        Require(sender_.assign(fd) == 0, "assign");
    }
    void Send() { Require(sender_.send(message_) == 0, "send"); }
    void Recv() {
        PObject received;
        Require(sender_.recv(received) == 0, "recv");
    }

private:
    const PObject& message_;
    ZEL::IPCSender sender_;
};

double Seconds(const std::function<void()>& work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
}

// Sends `count` messages one way, or asks and answers as many.
template <typename Peer, typename What>
double Transfer(bool tcp, bool answered, int count, const What& what) {
    const Connection connection(tcp);
    Peer near(connection.fds[0], what);
    Peer far(connection.fds[1], what);
    return Seconds([&] {
        std::thread other([&] {
            for (int i = 0; i < count; ++i) {
                far.Recv();
                if (answered) {
                    far.Send();
                }
            }
        });
        for (int i = 0; i < count; ++i) {
            near.Send();
            if (answered) {
                near.Recv();
            }
        }
        other.join();
    });
}

// The number of bytes of a message on the wire.
size_t WireSize(const PObject& message) {
    const Connection connection(false);
    size_t size = 0;
    std::thread counter([&] {
        std::vector<char> buffer(kCapacity);
        for (ssize_t n; (n = read(connection.fds[1], buffer.data(), buffer.size())) > 0;) {
            size += static_cast<size_t>(n);
        }
        close(connection.fds[1]);
    });
    MessagePeer(connection.fds[0], message).Send();
    counter.join();
    return size;
}

void CompareMessages(const char* name, bool tcp, bool answered, int count, const PObject& message) {
    const size_t size = WireSize(message);
    double ours = 1e9;
    double bare = 1e9;
    for (int i = 0; i < kRounds; ++i) {
        ours = std::min(ours, Transfer<MessagePeer>(tcp, answered, count, message));
        bare = std::min(bare, Transfer<BarePeer>(tcp, answered, count, size));
    }
    const double bytes = static_cast<double>(size) * count * (answered ? 2 : 1);
    printf(
        "%-4s %-22s %6zu bytes: %8.0f a second, %7.1f MB/s; bare socket %8.0f a second: %.2f of "
        "its speed\n",
        tcp ? "tcp" : "unix", name, size, count / ours, bytes / ours / 1e6, count / bare,
        bare / ours);
}

void CompareFilteredLog() {
    constexpr int kCalls = 50000000;
    std::atomic<int> level{ZEL::Logger::LEVEL_ERROR};
    double ours = 1e9;
    double bare = 1e9;
    for (int i = 0; i < kRounds; ++i) {
        ours =
            std::min(ours, Seconds([] {
                         for (int n = 0; n < kCalls; ++n) {
                             ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_DEBUG,
                                                 "[DEBUG] ZEL/bench(%d): %d bytes\n", __LINE__, n);
                         }
                     }));
        bare = std::min(
            bare, Seconds([&level] {
                for (int n = 0; n < kCalls; ++n) {
                    if (level.load(std::memory_order_relaxed) >= ZEL::Logger::LEVEL_DEBUG) {
                        abort();
                    }
                }
            }));
    }
    printf("filtered log call: %.2f ns; a bare compare %.2f ns: %.1f times as long\n",
           ours / kCalls * 1e9, bare / kCalls * 1e9, ours / bare);
}

}  // namespace

int main() {
    PObject request;
    request["action"] = "run";
    request["task_id"] = 42;
    request["share_list"].asArray() = {"photo", "music", "home"};
    request["limit"] = 1048576;
    PObject table;
    for (unsigned long long i = 0; i < 500; ++i) {
        PObject row;
        row["id"] = i;
        row["name"] = "a share's name of middling length";
        row["bytes"] = i * 1234567;
        table.asArray().push_back(row);
    }
    PObject block;
    block.asArray().assign(4, std::string(60000, 'x'));

    for (const bool tcp : {false, true}) {
        CompareMessages("small requests one way", tcp, false, 200000, request);
        CompareMessages("small, with replies", tcp, true, 20000, request);
        CompareMessages("tables of 500 rows", tcp, false, 1000, table);
        CompareMessages("60 kB strings", tcp, false, 4000, block);
        CompareMessages("60 kB, with replies", tcp, true, 500, block);
    }
    CompareFilteredLog();
}

// Passes connections on to a port of this machine, and counts what goes through them.
#pragma once

#include <arpa/inet.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <list>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>

#include "base/unique_fd.h"

namespace bench {

/// Both directions, without the headers of the network.
class CountingRelay {
public:
    /// From the first port of a loopback address to the second of 127.0.0.1.
    explicit CountingRelay(std::pair<int, int> ports, const std::string& address = "127.0.0.1")
        : listener_(Socket()), to_(ports.second) {
        const int on = 1;
        setsockopt(listener_.Get(), SOL_SOCKET, SO_REUSEADDR, &on, sizeof on);
        sockaddr_in own = Loopback(ports.first);
        inet_pton(AF_INET, address.c_str(), &own.sin_addr);
        if (bind(listener_.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof own) != 0 ||
            listen(listener_.Get(), 64) != 0) {
            throw std::runtime_error("no relay can listen");
        }
        acceptor_ = std::thread([this] { Accept(); });
    }
    ~CountingRelay() {
        shutdown(listener_.Get(), SHUT_RDWR);
        acceptor_.join();
        for (std::thread& thread : threads_) {
            thread.join();
        }
    }
    CountingRelay(const CountingRelay&) = delete;
    CountingRelay& operator=(const CountingRelay&) = delete;

    uint64_t Bytes() const { return bytes_; }
    uint64_t Connections() const { return connections_; }

private:
    static void SendAtOnce(int socket) {
        const int on = 1;
        setsockopt(socket, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    }
    static base::UniqueFd Socket() {
        return base::UniqueFd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    }
    static sockaddr_in Loopback(int port) {
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_port = htons(static_cast<uint16_t>(port));
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        return address;
    }

    void Accept() {
        for (;;) {
            base::UniqueFd client(accept4(listener_.Get(), nullptr, nullptr, SOCK_CLOEXEC));
            if (!client) {
                return;
            }
            ++connections_;
            threads_.emplace_back(
                [this, held = std::move(client)]() mutable { Pass(std::move(held)); });
        }
    }
    void Pass(base::UniqueFd client) {
        const base::UniqueFd server = Socket();
        const sockaddr_in address = Loopback(to_);
        if (connect(server.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) !=
            0) {
            return;
        }
        SendAtOnce(client.Get());
        SendAtOnce(server.Get());
        pollfd ends[2] = {{client.Get(), POLLIN, 0}, {server.Get(), POLLIN, 0}};
        char bytes[65536];
        while (ends[0].fd >= 0 || ends[1].fd >= 0) {
            poll(ends, 2, -1);
            for (int i = 0; i < 2; ++i) {
                const int other = i == 0 ? server.Get() : client.Get();
                if (ends[i].revents == 0) {
                    continue;
                }
                const ssize_t count = read(ends[i].fd, bytes, sizeof bytes);
                if (count <= 0) {
                    ends[i].fd = -1;
                    shutdown(other, SHUT_WR);
                    continue;
                }
                bytes_ += static_cast<uint64_t>(count);
                for (ssize_t sent = 0; sent < count;) {
                    const ssize_t part =
                        send(other, bytes + sent, static_cast<size_t>(count - sent), MSG_NOSIGNAL);
                    if (part <= 0) {
                        return;
                    }
                    sent += part;
                }
            }
        }
    }

    base::UniqueFd listener_;
    const int to_;
    std::atomic<uint64_t> bytes_{0};
    std::atomic<uint64_t> connections_{0};
    std::list<std::thread> threads_;  // the acceptor's, until it has ended
    std::thread acceptor_;
};

}  // namespace bench

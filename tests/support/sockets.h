#pragma once

#include <sys/socket.h>
#include <unistd.h>

#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>

#include "ZEL/channel.h"

namespace test {

/// A channel on one end of a socket pair; the other end is handled byte by byte.
class RawPeer {
public:
    explicit RawPeer(unsigned int capacity = 81920) : channel(capacity) {
        int fds[2];
        if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0 ||
            channel.Open(fds[0], true) != 0) {
            throw std::runtime_error("no socket pair");
        }
        channel_fd = fds[0];
        fd = fds[1];
    }
    ~RawPeer() { Close(); }
    RawPeer(const RawPeer&) = delete;
    RawPeer& operator=(const RawPeer&) = delete;

    void Send(const std::string& bytes) const {
        if (write(fd, bytes.data(), bytes.size()) != static_cast<ssize_t>(bytes.size())) {
            throw std::runtime_error("cannot write to the pair");
        }
    }
    /// What has arrived; with 0, all that arrives until the channel's side is closed.
    std::string Take(int flags = MSG_DONTWAIT) const {
        std::string bytes;
        char buffer[4096];
        for (ssize_t n; (n = recv(fd, buffer, sizeof buffer, flags)) > 0;) {
            bytes.append(buffer, static_cast<size_t>(n));
        }
        return bytes;
    }
    void Close() { close(std::exchange(fd, -1)); }

    ZEL::Channel channel;
    int channel_fd = -1;  ///< the channel's own end
    int fd = -1;          ///< the other end
};

/// "42 10 00" to the three bytes, and back.
inline std::string Unhex(const std::string& text) {
    std::istringstream input(text);
    std::string bytes;
    for (unsigned int byte; input >> std::hex >> byte;) {
        bytes += static_cast<char>(byte);
    }
    return bytes;
}
inline std::string Hex(const std::string& bytes) {
    constexpr char kDigits[] = "0123456789abcdef";
    std::string text;
    for (const unsigned char byte : bytes) {
        text += text.empty() ? "" : " ";
        text += {kDigits[byte >> 4], kDigits[byte & 15]};
    }
    return text;
}

}  // namespace test

#pragma once

#include <sys/socket.h>
#include <unistd.h>

#include <cstdio>
#include <stdexcept>
#include <string>

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
    /// What has arrived; nothing is waited for.
    std::string Take() const {
        std::string bytes;
        char buffer[4096];
        for (ssize_t n; (n = recv(fd, buffer, sizeof buffer, MSG_DONTWAIT)) > 0;) {
            bytes.append(buffer, static_cast<size_t>(n));
        }
        return bytes;
    }
    /// True when the channel's side has been closed.
    bool SeesEnd() const {
        char byte;
        return recv(fd, &byte, 1, MSG_DONTWAIT) == 0;
    }
    void Close() {
        if (fd >= 0) {
            close(fd);
        }
        fd = -1;
    }

    ZEL::Channel channel;
    int channel_fd = -1;  ///< the channel's own end
    int fd = -1;          ///< the other end
};

/// "42 10 00" to the three bytes, and back.
inline std::string Unhex(const std::string& text) {
    std::string bytes;
    unsigned int byte = 0;
    int used = 0;
    for (size_t at = 0; sscanf(text.c_str() + at, "%x%n", &byte, &used) == 1;
         at += static_cast<size_t>(used)) {
        bytes += static_cast<char>(byte);
    }
    return bytes;
}
inline std::string Hex(const std::string& bytes) {
    std::string text;
    char pair[4];
    for (const char byte : bytes) {
        snprintf(pair, sizeof pair, "%s%02x", text.empty() ? "" : " ",
                 static_cast<unsigned int>(static_cast<unsigned char>(byte)));
        text += pair;
    }
    return text;
}

}  // namespace test

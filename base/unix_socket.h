#pragma once

#include <sys/socket.h>
#include <sys/un.h>

#include <cstring>
#include <optional>
#include <string>

namespace base {

/// The address of a Unix socket in the file system.
class UnixAddress {
public:
    /// Nothing when the path is too long for a socket address (107 bytes).
    static std::optional<UnixAddress> Of(const std::string& path) {
        UnixAddress result;
        if (path.size() >= sizeof result.address_.sun_path) {
            return std::nullopt;
        }
        result.address_.sun_family = AF_UNIX;
        memcpy(result.address_.sun_path, path.c_str(), path.size() + 1);
        return result;
    }

    const sockaddr* Get() const { return reinterpret_cast<const sockaddr*>(&address_); }
    socklen_t Size() const { return sizeof address_; }

private:
    sockaddr_un address_ = {};
};

/// The process at the other end of a Unix socket, as it was when it connected. Nothing, with errno
/// set, when the kernel does not tell.
inline std::optional<ucred> PeerOf(int fd) {
    ucred peer = {};
    socklen_t size = sizeof peer;
    return getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &size) == 0 ? std::optional<ucred>(peer)
                                                                      : std::nullopt;
}

}  // namespace base

#include "ZEL/ipc.h"

#include <arpa/inet.h>
#include <errno.h>
#include <limits.h>
#include <netinet/in.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>

#include "ZEL/internal/channel_socket.h"
#include "ZEL/log.h"
#include "ZEL/stream.h"
#include "base/unique_fd.h"

namespace ZEL {

namespace {

using base::UniqueFd;

constexpr int kBacklog = 8;
constexpr unsigned int kChannelCapacity = 81920;
constexpr char kLoopback[] = "127.0.0.1";

// Logs that a call failed, with errno; always -1.
int CallFailed(const char* call) {
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/ipc(%d): %s: %s (%d)\n", __LINE__, call,
                   strerror(errno), errno);
    return -1;
}

UniqueFd NewSocket(int family) {
    UniqueFd fd(socket(family, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd) {
        CallFailed("socket");
    }
    return fd;
}

int BindLoopback(int fd, int port) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    address.sin_port = htons(static_cast<uint16_t>(port));
    if (bind(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        return CallFailed("bind");
    }
    return 0;
}

int Listen(int fd) {
    return listen(fd, kBacklog) == 0 ? 0 : CallFailed("listen");
}

// The port that the system has chosen for a socket bound to port 0; -1 when it cannot be told.
int BoundPort(int fd) {
    sockaddr_in address = {};
    socklen_t size = sizeof address;
    if (getsockname(fd, reinterpret_cast<sockaddr*>(&address), &size) != 0) {
        return CallFailed("getsockname");
    }
    return ntohs(address.sin_port);
}

int ToIpcResult(int code) {
    return code == RESULT_SUCCESS ? 0 : -1;
}

}  // namespace

IPCListener::~IPCListener() {
    close();
}

int IPCListener::prepare(int port) {
    close();
    UniqueFd fd = NewSocket(AF_INET);
    if (!fd) {
        return -1;
    }
    const int bound = do_bind(fd.Get(), port);
    if (bound < 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/ipc(%d): find available port failed\n",
                       __LINE__);
        return -1;
    }
    if (Listen(fd.Get()) != 0) {
        return -1;
    }
    Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] ZEL/ipc(%d): listening on port %d\n", __LINE__,
                   bound);
    fd_ = fd.Release();
    return bound;
}

int IPCListener::prepare(const std::string& path) {
    if (fd_ != -1) {
        return -1;
    }
    const int fd = OpenDomainSocket(path);
    if (fd < 0) {
        return -1;
    }
    fd_ = fd;
    path_ = path;
    return 0;
}

bool IPCListener::isReady() {
    if (fd_ == -1) {
        return false;
    }
    pollfd watched = {fd_, POLLIN, 0};
    return poll(&watched, 1, PollMilliseconds(timeout_seconds_, timeout_microseconds_)) > 0 &&
           (watched.revents & POLLNVAL) == 0;
}

int IPCListener::accept() {
    return fd_ == -1 ? -1 : accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
}

void IPCListener::close() {
    if (fd_ == -1) {
        return;
    }
    if (path_.empty()) {
        CloseSocket(fd_);
    } else {
        CloseDomainSocket(fd_);
    }
    fd_ = -1;
    path_.clear();
}

int IPCListener::do_bind(int fd, int port) {
    for (int candidate = port;; ++candidate) {
        Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] ZEL/ipc(%d): Try to bind port: %d\n", __LINE__,
                       candidate);
        if (candidate > USHRT_MAX) {
            Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/ipc(%d): Port number exceeds 65536\n",
                           __LINE__);
            return -1;
        }
        if (candidate < 0) {
            return -1;
        }
        if (BindLoopback(fd, candidate) == 0) {
            Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] ZEL/ipc(%d): Bind port %d success\n",
                           __LINE__, candidate);
            return candidate == 0 ? BoundPort(fd) : candidate;
        }
        Logger::LogMsg(Logger::LEVEL_INFO,
                       "[INFO] ZEL/ipc(%d): Bind port %d failed, try next one\n", __LINE__,
                       candidate);
    }
}

int IPCListener::OpenSocket(int port) {
    if (port < 1 || port > USHRT_MAX) {
        return -1;
    }
    UniqueFd fd = NewSocket(AF_INET);
    if (!fd || BindLoopback(fd.Get(), port) != 0 || Listen(fd.Get()) != 0) {
        return -1;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/ipc(%d): listening on port %d\n", __LINE__,
                   port);
    return fd.Release();
}

int IPCListener::OpenDomainSocket(const std::string& path) {
    if (path.empty()) {
        return -1;
    }
    UniqueFd fd = NewSocket(AF_UNIX);
    if (!fd) {
        return -1;
    }
    unlink(path.c_str());
    const int reuse = 1;
    if (setsockopt(fd.Get(), SOL_SOCKET, SO_REUSEADDR, &reuse, sizeof reuse) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/ipc(%d): failed to setsockopt\n",
                       __LINE__);
    }
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    memcpy(address.sun_path, path.data(), std::min(path.size(), sizeof address.sun_path));
    if (bind(fd.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        CallFailed("bind");
    } else if (Listen(fd.Get()) == 0) {
        Logger::LogMsg(Logger::LEVEL_DEBUG,
                       "[DEBUG] ZEL/ipc(%d): listening on domain socket '%s'\n", __LINE__,
                       path.c_str());
        return fd.Release();
    }
    CloseDomainSocket(fd.Release());
    return -1;
}

int IPCListener::CloseSocket(int fd) {
    if (fd == -1) {
        return -1;
    }
    shutdown(fd, SHUT_RDWR);
    ::close(fd);
    return 0;
}

int IPCListener::CloseDomainSocket(int fd) {
    if (fd < 0) {
        return -1;
    }
    sockaddr_un address = {};
    socklen_t size = sizeof address;
    if (getsockname(fd, reinterpret_cast<sockaddr*>(&address), &size) != 0) {
        CallFailed("getsockname");
    }
    ::close(fd);
    // A path of the full length has no terminator.
    const std::string path(address.sun_path, strnlen(address.sun_path, sizeof address.sun_path));
    if (!path.empty()) {
        unlink(path.c_str());
    }
    return 0;
}

IPCSender::IPCSender() : channel_(kChannelCapacity) {}

IPCSender::~IPCSender() = default;

int IPCSender::connect(const std::string& path) {
    return ToIpcResult(channel_.Open(path.c_str()));
}

int IPCSender::connect(int port) {
    const int result = channel_.Open(kLoopback, port);
    // A negative port opens nothing, which the channel does not report.
    return channel_.IsClosed() ? -1 : ToIpcResult(result);
}

int IPCSender::assign(int fd) {
    return ToIpcResult(channel_.Open(fd, true));
}

int IPCSender::send(const PObject& request, bool want_reply, PObject& reply) {
    PStream stream;
    if (stream.Send(channel_, request) != RESULT_SUCCESS) {
        return -1;
    }
    return want_reply ? recv(reply) : 0;
}

int IPCSender::send(const PObject& request) {
    PObject no_reply;
    return IPCSender::send(request, false, no_reply);
}

int IPCSender::recv(PObject& value) {
    PStream stream;
    return ToIpcResult(stream.Recv(channel_, value));
}

void IPCSender::close() {
    channel_.Close();
}

}  // namespace ZEL

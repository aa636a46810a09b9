// A channel's plain mode: bytes go to the socket and come from it as they are.
#include <errno.h>
#include <string.h>
#include <sys/socket.h>

#include "ZEL/channel.h"
#include "ZEL/internal/channel_socket.h"
#include "ZEL/log.h"

namespace ZEL {

namespace {

int SocketOf(void* handle) {
    return handle == nullptr ? -1 : static_cast<PlainSocket*>(handle)->fd;
}

// Whether the peer can send urgent data, which must be noticed before anything is transferred. On
// other sockets the transfer itself tells whether it would block.
bool SeesUrgentData(void* handle) {
    return handle == nullptr || static_cast<PlainSocket*>(handle)->can_be_urgent;
}

int ReadFd(void* handle, char* buffer, unsigned int length, const timeval& interval,
           const int* flag) {
    const int fd = SocketOf(handle);
    const int refused = RefuseEmptyRead(length);
    if (refused < 0) {
        return refused;
    }
    const auto try_recv = [&](int flags) {
        errno = 0;  // the end of the stream sets none, and is logged with its text
        return recv(fd, buffer, length, flags);
    };
    Patience* const patience =
        handle == nullptr ? nullptr : &static_cast<PlainSocket*>(handle)->patience;
    ssize_t count = -1;
    const bool tried = !SeesUrgentData(handle) && !Aborted(flag);
    if (tried) {
        const auto came = [&] {
            count = try_recv(MSG_DONTWAIT);
            return count >= 0 || errno != EAGAIN;
        };
        if (!came()) {
            patience->LookForAMoment(flag, came);
        }
    }
    if (!tried || (count < 0 && errno == EAGAIN)) {
        const int result = WaitReadable(fd, interval, flag, tried ? nullptr : patience);
        if (result < 0) {
            return result;
        }
        count = try_recv(0);
    }
    if (count > 0) {
        return TellRead(static_cast<int>(count));
    }
    Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): read: %s\n", __LINE__,
                   strerror(errno));
    if (count == 0) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): Diagnose: select says the socket is readable but "
            "actually we can't read ... connection closed?\n",
            __LINE__);
    }
    return RESULT_IO;
}

int WriteFd(void* handle, const char* data, unsigned int length, const timeval& interval,
            const int* flag) {
    const int fd = SocketOf(handle);
    // MSG_DONTWAIT: on a descriptor that was left blocking, a large block would wait for longer
    // than the slice.
    const auto try_send = [&] {
        errno = 0;
        return send(fd, data, length, MSG_NOSIGNAL | MSG_DONTWAIT);
    };
    ssize_t count = -1;
    const bool tried = !SeesUrgentData(handle) && !Aborted(flag);
    if (tried) {
        count = try_send();
    }
    if (!tried || (count < 0 && errno == EAGAIN)) {
        const int result = WaitWritable(fd, interval, flag, "exception occurs");
        if (result < 0) {
            return result;
        }
        count = try_send();
    }
    if (count > 0) {
        return TellWritten(static_cast<int>(count));
    }
    Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): write: %s\n", __LINE__,
                   strerror(errno));
    if (count == 0) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): Diagnose: select says the socket is writeable but "
            "actually we can't write ... connection closed?\n",
            __LINE__);
    }
    return RESULT_IO;
}

void ClosePlain(void* handle) {
    CloseSocket(SocketOf(handle));
    delete static_cast<PlainSocket*>(handle);
}

bool IsPlainClosed(void* handle) {
    return SocketOf(handle) == -1;
}

bool IsUnixSocket(int fd) {
    int domain = 0;
    socklen_t size = sizeof domain;
    return getsockopt(fd, SOL_SOCKET, SO_DOMAIN, &domain, &size) == 0 && domain == AF_UNIX;
}

}  // namespace

const ChannelOps kPlainOps = {ReadFd, WriteFd, SocketOf, ClosePlain, IsPlainClosed};

PlainSocket* NewPlainSocket(int fd) {
    return new PlainSocket{fd, !IsUnixSocket(fd)};
}

}  // namespace ZEL

#include <errno.h>
#include <limits.h>
#include <poll.h>
#include <string.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>

#include "ZEL/internal/channel_socket.h"
#include "ZEL/log.h"

namespace ZEL {

namespace {

// The events of poll(2) that select(2) would report in each of its sets.
constexpr short kReadEvents = POLLIN | POLLHUP | POLLERR;
constexpr short kWriteEvents = POLLOUT | POLLERR;

}  // namespace

int PollMilliseconds(int64_t seconds, int64_t microseconds) {
    const int64_t milliseconds =
        std::clamp<int64_t>(seconds, -1, INT_MAX) * 1000 + (microseconds + 999) / 1000;
    return static_cast<int>(std::clamp<int64_t>(milliseconds, 0, INT_MAX));
}

int WaitFd(int fd, Watch watch, const timeval& interval, const int* flag, Patience* patience,
           Readiness& readiness) {
    const bool reading = watch == Watch::kRead;
    pollfd watched = {fd, static_cast<short>((reading ? POLLIN : POLLOUT) | POLLPRI), 0};
    const auto ask = [&](int milliseconds) {
        // poll() ignores negative descriptors and reports closed ones; both are errors here.
        const int ready = fd < 0 ? 1 : poll(&watched, 1, milliseconds);
        if (fd < 0 || (ready > 0 && (watched.revents & POLLNVAL) != 0)) {
            errno = EBADF;
            return -1;
        }
        return ready;
    };
    // A socket is nearly always writable, and asking without a time-out is cheaper than waiting.
    for (bool look = !reading || patience != nullptr;; look = false) {
        if (Aborted(flag)) {
            return RESULT_INTERRUPTED;
        }
        int ready = ask(look ? 0 : PollMilliseconds(interval.tv_sec, interval.tv_usec));
        if (ready == 0 && look && patience != nullptr) {
            patience->LookForAMoment(flag, [&] {
                ready = ask(0);
                return ready != 0;
            });
        }
        if (ready > 0) {
            readiness.ready = (watched.revents & (reading ? kReadEvents : kWriteEvents)) != 0;
            readiness.exception = (watched.revents & POLLPRI) != 0;
            return RESULT_SUCCESS;
        }
        if (ready == 0 && look) {
            continue;
        }
        if (ready == 0) {
            Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): select: timeout\n",
                           __LINE__);
            return RESULT_TIMEOUT;
        }
        if (errno != EINTR) {
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): select: %s (%d)\n",
                           __LINE__, strerror(errno), errno);
            return RESULT_SYSTEM;
        }
    }
}

int WaitReadable(int fd, const timeval& interval, const int* flag, Patience* patience) {
    Readiness readiness;
    const int result = WaitFd(fd, Watch::kRead, interval, flag, patience, readiness);
    if (result < 0) {
        return result;
    }
    if (readiness.exception) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): ReadFd: exception set\n",
                       __LINE__);
        return RESULT_IO;
    }
    if (!readiness.ready) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): ReadFd: select but fd [%d] not ready\n",
                       __LINE__, fd);
        return RESULT_SYSTEM;
    }
    return RESULT_SUCCESS;
}

int WaitWritable(int fd, const timeval& interval, const int* flag, const char* urgent_text) {
    Readiness readiness;
    const int result = WaitFd(fd, Watch::kWrite, interval, flag, nullptr, readiness);
    if (result < 0) {
        return result;
    }
    if (readiness.exception) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): WriteFd: %s\n", __LINE__,
                       urgent_text);
        return RESULT_IO;
    }
    if (!readiness.ready) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): WriteFd: select but fd [%d] not ready\n",
                       __LINE__, fd);
        return RESULT_SYSTEM;
    }
    return RESULT_SUCCESS;
}

int RefuseEmptyRead(unsigned int length) {
    if (length == 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): ReadFd: request 0\n",
                       __LINE__);
        return RESULT_INVALID_ARGUMENT;
    }
    return RESULT_SUCCESS;
}

int TellRead(int count) {
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): ReadFd: read %d bytes\n",
                   __LINE__, count);
    return count;
}

int TellWritten(int count) {
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): WriteFd: write %d bytes\n",
                   __LINE__, count);
    return count;
}

void CloseSocket(int fd) {
    if (shutdown(fd, SHUT_RDWR) != 0) {
        Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): Channel: shutdown: %s\n",
                       __LINE__, strerror(errno));
    }
    close(fd);
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): Channel: socket %d closed\n",
                   __LINE__, fd);
}

}  // namespace ZEL

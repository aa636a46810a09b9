// The service's daemon, scratch files and file locks: the last part of zel.h.
#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <unistd.h>

#include <utility>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "tarq/core.h"
#include "tarq/root_path.h"
#include "tarq/systemd.h"

namespace ZEL {

namespace {

constexpr char kDaemonUnit[] = "zel_daemon";
constexpr char kTempTemplate[] = "/tmp/ZEL/temp.XXXXXX";
constexpr mode_t kLockFileMode = 0600;

// Repeats a system call that a signal has interrupted before it did anything.
template <typename Call>
int RetryInterrupted(Call call) {
    int result = 0;
    do {
        result = call();
    } while (result < 0 && errno == EINTR);
    return result;
}

}  // namespace

bool IsDaemonRunning() {
    return TARQSystemdActiveStatusGet(kDaemonUnit) == 1;
}

int StartDaemon() {
    if (TARQSystemdStart(kDaemonUnit) != 0) {
        return 0;
    }
    const int error = KAPICErrGet();
    if (error == TARQ_ERR_SERVICE_BUSY) {
        return 0;  // it is on its way up, which is what was asked for
    }
    Logger::LogMsg(Logger::LEVEL_ERROR,
                   "[ERROR] ZEL/zel(%d): Fail to start daemon, tarqerr=[0x%04X]\n", __LINE__,
                   static_cast<unsigned int>(error));
    return -1;
}

int StopDaemon() {
    if (TARQSystemdStop(kDaemonUnit) != 0) {
        return 0;
    }
    Logger::LogMsg(Logger::LEVEL_ERROR,
                   "[ERROR] ZEL/zel(%d): Fail to stop daemon, tarqerr=[0x%04X]\n", __LINE__,
                   static_cast<unsigned int>(KAPICErrGet()));
    return -1;
}

bool IsPathExist(const std::string& path) {
    return access(path.c_str(), F_OK) == 0;
}

std::string GetTempFile() {
    std::string path = TARQ::RootPath(kTempTemplate);
    const int fd = mkostemp64(path.data(), O_CLOEXEC);
    if (fd < 0) {
        return "";
    }
    close(fd);
    return path;
}

void PutTempFile(const std::string& path) {
    if (!path.empty() && unlink(path.c_str()) != 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/zel(%d): Fail to unlink temp file '%s' [%d]\n", __LINE__,
                       path.c_str(), errno);
    }
}

SimpleFileLock::SimpleFileLock(const std::string& path)
    : fd_(RetryInterrupted(
          [&] { return open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, kLockFileMode); })) {
    if (fd_ < 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR,
                       "[ERROR] ZEL/zel(%d): Fail to open lock file at '%s', error:'%s'\n",
                       __LINE__, path.c_str(), strerror(errno));
    }
}

SimpleFileLock::~SimpleFileLock() {
    if (fd_ >= 0) {
        close(fd_);
    }
}

SimpleFileLock::SimpleFileLock(SimpleFileLock&& other) noexcept
    : locked_(std::exchange(other.locked_, false)), fd_(std::exchange(other.fd_, -1)) {}

SimpleFileLock& SimpleFileLock::operator=(SimpleFileLock&& other) noexcept {
    SimpleFileLock taken(std::move(other));
    std::swap(locked_, taken.locked_);
    std::swap(fd_, taken.fd_);
    return *this;
}

int SimpleFileLock::ExLock() {
    if (locked_) {
        return 0;
    }
    if (fd_ < 0) {
        return -1;
    }
    // A wait that a signal cuts short goes on: whoever wants out of it ends the process.
    if (RetryInterrupted([&] { return flock(fd_, LOCK_EX); }) != 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): Fail to lock, error:'%s'\n",
                       __LINE__, strerror(errno));
        return -1;
    }
    locked_ = true;
    return 0;
}

int SimpleFileLock::UnLock() {
    if (!locked_) {
        return 0;
    }
    if (RetryInterrupted([&] { return flock(fd_, LOCK_UN); }) != 0) {
        Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] ZEL/zel(%d): Fail to unlock, error:'%s'\n",
                       __LINE__, strerror(errno));
        return -1;
    }
    locked_ = false;
    return 0;
}

SimpleFileLock LockFactory::GetLock() const {
    return SimpleFileLock(path_);
}

}  // namespace ZEL

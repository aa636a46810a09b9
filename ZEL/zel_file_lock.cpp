// Locks on files, between processes: the last part of zel.h.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/file.h>
#include <unistd.h>

#include <utility>

#include "ZEL/log.h"
#include "ZEL/zel.h"

namespace ZEL {

namespace {

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
    // An interrupted wait is resumed: signals do not cancel it.
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

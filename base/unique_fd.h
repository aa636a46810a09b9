#pragma once

#include <errno.h>
#include <unistd.h>

#include <utility>

namespace base {

/// Owns a file descriptor; closes it, with errno kept, when destroyed.
class UniqueFd {
public:
    UniqueFd() = default;
    explicit UniqueFd(int fd) : fd_(fd) {}
    UniqueFd(UniqueFd&& other) noexcept : fd_(other.Release()) {}
    UniqueFd& operator=(UniqueFd&& other) noexcept {
        std::swap(fd_, other.fd_);
        return *this;
    }
    ~UniqueFd() { Reset(); }

    int Get() const { return fd_; }
    explicit operator bool() const { return fd_ >= 0; }
    /// The descriptor, which is the caller's from now on.
    int Release() { return std::exchange(fd_, -1); }
    void Reset() {
        if (fd_ >= 0) {
            const int saved = errno;
            close(Release());
            errno = saved;
        }
    }

private:
    int fd_ = -1;
};

}  // namespace base

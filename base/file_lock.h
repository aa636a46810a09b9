#pragma once

#include <chrono>
#include <string>

#include "base/unique_fd.h"

namespace base {

/// An exclusive lock between processes, and between threads: whoever has locked the file at `path`,
/// which is made when it is not there and never removed. The kernel gives the lock back when its
/// holder dies.
///
/// Only root and the file's owner can open the file, so nobody else can hold the lock. A file that
/// belongs to a stranger or that others may open is refused.
///
/// No wait is longer than `limit`. Those who wait take turns: whoever gives the lock back and wants
/// it again goes to the end of the line.
class FileLock {
public:
    FileLock() = default;  ///< holds nothing
    FileLock(const std::string& path, std::chrono::milliseconds limit);
    FileLock(FileLock&&) noexcept = default;
    FileLock& operator=(FileLock&&) noexcept = default;
    ~FileLock() { Release(); }

    explicit operator bool() const { return static_cast<bool>(held_); }
    /// Why the lock was not taken: a sentence that names the file, and who holds it when that is
    /// known. errno tells the same: EWOULDBLOCK when the time was up.
    const std::string& Problem() const { return problem_; }
    void Release();
    /// Lets go of the descriptor alone: for the child of a fork(), where the parent goes on holding
    /// the lock.
    void Forget() { held_.Reset(); }

private:
    UniqueFd held_;
    std::string problem_;
};

}  // namespace base

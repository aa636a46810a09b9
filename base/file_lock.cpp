#include "base/file_lock.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <sys/types.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "base/text.h"
#include "base/whole_file.h"

namespace base {
namespace {

using std::chrono::duration_cast;
using std::chrono::milliseconds;
using std::chrono::steady_clock;

constexpr mode_t kOwnerOnly = 0600;
constexpr mode_t kOthers = 0077;
constexpr milliseconds kLongestSleep(100);
constexpr milliseconds kBlindSleep(2);

// Two bytes of the file are locked, so that those who wait are served in turn: only who has the
// turn may try for the lock itself. Without it, a process that takes the lock again and again
// leaves the others no moment in which they would find it free.
enum Byte : off_t { kLock, kTurn };

int Operate(int fd, short type, Byte byte) {
    struct flock range = {};
    range.l_type = type;
    range.l_whence = SEEK_SET;
    range.l_start = byte;
    range.l_len = 1;
    int result = 0;
    do {
        result = fcntl(fd, F_OFD_SETLK, &range);
    } while (result != 0 && errno == EINTR);
    return result;
}

/// Sleeps until somebody may have given a lock on the file back: whoever does closes it, and the
/// kernel closes it for one that dies.
class Doorbell {
public:
    explicit Doorbell(const std::string& path) : path_(path) {}

    void WaitUntil(steady_clock::time_point deadline) {
        const auto left = duration_cast<milliseconds>(deadline - steady_clock::now());
        if (!tried_) {
            tried_ = true;  // and tell the caller to look once more, now that nothing is missed
            events_ = UniqueFd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
            if (events_ && inotify_add_watch(events_.Get(), path_.c_str(), IN_CLOSE_WRITE) < 0) {
                events_.Reset();
            }
            return;
        }
        // Without an inotify instance to be had this is a sleep.
        const milliseconds most = events_ ? kLongestSleep : kBlindSleep;
        pollfd event = {events_.Get(), POLLIN, 0};
        poll(&event, 1, static_cast<int>(std::clamp(left, milliseconds(0), most).count()));
        char told[1024];
        while (events_ && read(events_.Get(), told, sizeof told) > 0) {
        }
    }

private:
    const std::string& path_;
    UniqueFd events_;
    bool tried_ = false;
};

/// Takes the byte's lock as soon as it is free. False with errno set: EWOULDBLOCK after `deadline`.
bool WaitFor(int fd, Byte byte, steady_clock::time_point deadline, Doorbell& doorbell) {
    for (;;) {
        if (Operate(fd, F_WRLCK, byte) == 0) {
            return true;
        }
        if (errno != EAGAIN && errno != EACCES) {
            return false;
        }
        if (steady_clock::now() >= deadline) {
            errno = EWOULDBLOCK;
            return false;
        }
        doorbell.WaitUntil(deadline);
    }
}

/// The lock's file, safe to wait for; an empty owner with `problem` and errno set otherwise.
UniqueFd OpenLockFile(const std::string& path, std::string& problem) {
    const std::string parent = path.substr(0, path.rfind('/') + 1);
    const UniqueFd folder(
        open(parent.empty() ? "." : parent.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    UniqueFd file(folder ? openat(folder.Get(), path.c_str() + parent.size(),
                                  O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK | O_NOCTTY,
                                  kOwnerOnly)
                         : -1);
    struct stat in {};
    struct stat own {};
    if (!file || fstat(folder.Get(), &in) != 0 || fstat(file.Get(), &own) != 0) {
        problem = "cannot open the lock file " + path + ": " + strerror(errno);
        return {};
    }
    // In a folder of somebody else's, root leaves him a file that he can use.
    const bool root = geteuid() == 0;
    if (root && own.st_uid == 0 && in.st_uid != 0 &&
        fchown(file.Get(), in.st_uid, in.st_gid) == 0) {
        own.st_uid = in.st_uid;
    }
    const bool trusted =
        own.st_uid == 0 || own.st_uid == geteuid() || (root && own.st_uid == in.st_uid);
    if (!S_ISREG(own.st_mode) || !trusted || (own.st_mode & kOthers) != 0) {
        problem = "the lock file " + path +
                  " is not a file that only root or its owner can open: remove it";
        errno = EPERM;
        return {};
    }
    return file;
}

/// Whether `path` still stands for the open file: a lock on one that was removed excludes nobody.
bool IsAt(const std::string& path, int fd) {
    struct stat own {};
    struct stat named {};
    return fstat(fd, &own) == 0 && lstat(path.c_str(), &named) == 0 && own.st_dev == named.st_dev &&
           own.st_ino == named.st_ino;
}

/// The holder writes its number into the file. It is there for people: the kernel does not tell
/// whose a lock of this kind is.
void NoteHolder(int fd) {
    char number[32];
    const int size = snprintf(number, sizeof number, "%10d\n", static_cast<int>(getpid()));
    if (pwrite(fd, number, static_cast<size_t>(size), 0) < 0) {
        return;  // a full disk is no reason not to hold the lock
    }
}

std::string Holder(const std::string& path) {
    const auto number = ParseNumber(Trimmed(ReadFile(path, 64).value_or("")), INT32_MAX);
    if (!number || *number == 0) {
        return "another process";
    }
    const auto name = ReadFile("/proc/" + std::to_string(*number) + "/comm", 64);
    return "process " + std::to_string(*number) +
           (name ? " (" + std::string(Trimmed(*name)) + ")" : "");
}

std::string NotFree(const std::string& path, milliseconds limit) {
    const std::string seconds = std::to_string(limit.count() / 1000);
    return path +
           (limit.count() > 0 ? " was not free within " + seconds + " s: " : " is not free: ") +
           Holder(path) + " holds it";
}

}  // namespace

FileLock::FileLock(const std::string& path, milliseconds limit) {
    const auto deadline = steady_clock::now() + limit;
    Doorbell doorbell(path);
    do {
        held_ = OpenLockFile(path, problem_);
        if (!held_) {
            return;
        }
        if (!WaitFor(held_.Get(), kTurn, deadline, doorbell) ||
            !WaitFor(held_.Get(), kLock, deadline, doorbell)) {
            const int reason = errno;
            problem_ = reason == EWOULDBLOCK ? NotFree(path, limit)
                                             : "cannot lock " + path + ": " + strerror(reason);
            held_.Reset();
            errno = reason;
            return;
        }
        Operate(held_.Get(), F_UNLCK, kTurn);
    } while (!IsAt(path, held_.Get()));
    NoteHolder(held_.Get());
}

void FileLock::Release() {
    if (held_) {
        // Not only by the close: the child of a fork() may have the same open file.
        Operate(held_.Get(), F_UNLCK, kLock);
        held_.Reset();
    }
}

}  // namespace base

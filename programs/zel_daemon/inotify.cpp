#include "programs/zel_daemon/inotify.h"

#include <poll.h>
#include <sys/inotify.h>

#include <cerrno>
#include <cstdio>
#include <cstring>

#include "programs/common/host.h"

namespace zel_daemon {

namespace {

/// Some 2,000 events with names of usual length.
constexpr size_t kBufferSize = size_t{64} * 1024;

/// Files that were unlinked while open are notified of too (no IN_EXCL_UNLINK): what is written to
/// them may show under another name in the same folder.
constexpr uint32_t kMask = IN_CREATE | IN_DELETE | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB |
                           IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;

}  // namespace

Inotify::Inotify() : buffer_(new char[kBufferSize]) {}

int Inotify::Open() {
    if (fd_) {
        return 0;
    }
    fd_ = base::UniqueFd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
    if (fd_) {
        return 0;
    }
    const int error = errno;
    return error == EMFILE && programs::LackOfDescriptors(1) == 0 ? EUSERS : error;
}

int Inotify::Watch(int folder) {
    return WatchPath("/proc/self/fd/" + std::to_string(folder), kMask);
}

int Inotify::WatchPath(const std::string& path, uint32_t mask) {
    return inotify_add_watch(fd_.Get(), path.c_str(), mask);
}

void Inotify::Unwatch(int watch) {
    inotify_rm_watch(fd_.Get(), watch);
}

bool Inotify::Await(std::chrono::milliseconds time) const {
    pollfd waits = {fd_.Get(), POLLIN, 0};
    return Buffered() || poll(&waits, 1, static_cast<int>(time.count())) == 1;
}

std::optional<Inotify::Event> Inotify::Next() {
    inotify_event head;
    if (size_ - at_ < sizeof(head)) {
        at_ = size_ = 0;
        ssize_t got;
        do {
            got = read(fd_.Get(), buffer_.get(), kBufferSize);
        } while (got < 0 && errno == EINTR);
        if (got < static_cast<ssize_t>(sizeof(head))) {
            return std::nullopt;
        }
        size_ = static_cast<size_t>(got);
    }
    std::memcpy(&head, buffer_.get() + at_, sizeof(head));
    at_ += sizeof(head);
    const size_t length = std::min<size_t>(head.len, size_ - at_);
    const char* name = buffer_.get() + at_;
    at_ += length;
    return Event{head.wd, head.mask, head.cookie, {name, strnlen(name, length)}};
}

}  // namespace zel_daemon

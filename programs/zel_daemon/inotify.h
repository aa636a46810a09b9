// The kernel's change notices for folders.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/unique_fd.h"

namespace zel_daemon {

/// Threads: one thread.
class Inotify {
public:
    struct Event {
        int watch;              ///< -1: events were lost
        uint32_t mask;          ///< see inotify(7)
        uint32_t cookie;        ///< joins the two events of a move
        std::string_view name;  ///< of the entry; empty: the folder itself. Valid until Next()
    };

    Inotify();

    /// Gets an instance from the kernel, unless there is one: 0, or why there is none. EUSERS: the
    /// user has as many as it may (fs.inotify.max_user_instances), for which the kernel's own error
    /// is the one of a process without descriptors.
    int Open();

    /// -1 without an instance. Readable when Next() has an event that was not read from the kernel
    /// yet.
    int Fd() const { return fd_.Get(); }

    /// Watches an open folder: by descriptor, so that it is this folder whatever becomes of its
    /// path. Returns the watch, the same one for a folder that is watched already; -1 with errno.
    /// REQUIRES an instance.
    int Watch(int folder);
    /// Watches what the path leads to, for these events alone. As Watch() otherwise.
    int WatchPath(const std::string& path, uint32_t mask);
    void Unwatch(int watch);

    /// The next event; nothing when none waits.
    std::optional<Event> Next();
    /// Waits until Next() has one, so long at most. REQUIRES an instance.
    bool Await(std::chrono::milliseconds time) const;
    /// True when events have been read from the kernel that Next() has not returned.
    bool Buffered() const { return at_ < size_; }

private:
    base::UniqueFd fd_;
    std::unique_ptr<char[]> buffer_;
    size_t size_ = 0;
    size_t at_ = 0;
};

}  // namespace zel_daemon

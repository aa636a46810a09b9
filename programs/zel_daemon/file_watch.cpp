#include "programs/zel_daemon/file_watch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <utility>

namespace zel_daemon {

FileWatch::FileWatch(const std::string& folder, std::vector<std::string> names)
    : names_(std::move(names)), fd_(inotify_init1(IN_CLOEXEC | IN_NONBLOCK)) {
    // The folder, as the files are replaced as a whole.
    if (fd_ && inotify_add_watch(fd_.Get(), folder.c_str(),
                                 IN_CREATE | IN_MOVED_TO | IN_CLOSE_WRITE) < 0) {
        fd_.Reset();
    }
}

bool FileWatch::Changed() {
    bool changed = false;
    alignas(inotify_event) char buffer[4096];
    for (ssize_t size; (size = read(fd_.Get(), buffer, sizeof buffer)) > 0;) {
        for (const char* at = buffer; at < buffer + size;) {
            inotify_event event;
            memcpy(&event, at, sizeof event);
            const char* const name = at + sizeof event;
            changed =
                changed || (event.mask & IN_Q_OVERFLOW) != 0 ||
                (event.len > 0 && std::find(names_.begin(), names_.end(), name) != names_.end());
            at = name + event.len;
        }
    }
    return changed;
}

}  // namespace zel_daemon

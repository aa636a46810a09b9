#include "programs/zel_daemon/zone_watch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <cstring>

namespace zel_daemon {

namespace {

// The zone is a link, which is replaced as a whole.
constexpr char kFolder[] = "/etc";
constexpr char kName[] = "localtime";

}  // namespace

ZoneWatch::ZoneWatch() {
    base::UniqueFd fd(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
    if (fd && inotify_add_watch(fd.Get(), kFolder, IN_CREATE | IN_MOVED_TO | IN_CLOSE_WRITE) >= 0) {
        fd_ = std::move(fd);
    }
}

bool ZoneWatch::Changed() {
    bool changed = false;
    alignas(inotify_event) char buffer[4096];
    for (ssize_t size; (size = read(fd_.Get(), buffer, sizeof buffer)) > 0;) {
        for (const char* at = buffer; at < buffer + size;) {
            inotify_event event;
            memcpy(&event, at, sizeof event);
            const char* name = at + sizeof event;
            changed = changed || (event.mask & IN_Q_OVERFLOW) != 0 ||
                      (event.len > 0 && strcmp(name, kName) == 0);
            at = name + event.len;
        }
    }
    return changed;
}

}  // namespace zel_daemon

#include "programs/zel_daemon/file_watch.h"

#include <sys/inotify.h>

#include <algorithm>
#include <utility>

namespace zel_daemon {

FileWatch::FileWatch(const std::string& folder, std::vector<std::string> names)
    : names_(std::move(names)) {
    // The folder, as the files are replaced as a whole.
    watched_ = inotify_.Open() == 0 &&
               inotify_.WatchPath(folder, IN_CREATE | IN_MOVED_TO | IN_CLOSE_WRITE) >= 0;
}

bool FileWatch::Changed() {
    bool changed = false;
    while (const auto event = inotify_.Next()) {
        changed = changed || (event->mask & IN_Q_OVERFLOW) != 0 ||
                  std::find(names_.begin(), names_.end(), event->name) != names_.end();
    }
    return changed;
}

}  // namespace zel_daemon

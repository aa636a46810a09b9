#include "programs/zel_daemon/place_watch.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <utility>

namespace zel_daemon {

namespace {

constexpr uint32_t kGoes = IN_MOVE_SELF | IN_DELETE_SELF | IN_ONLYDIR;
// In the last folder on a way that leads nowhere.
constexpr uint32_t kComes = IN_CREATE | IN_MOVED_TO;

}  // namespace

PlaceWatch::PlaceWatch() {
    inotify_.Open();
}

bool PlaceWatch::Changed() {
    bool changed = false;
    while (const auto event = inotify_.Next()) {
        const auto watched = watches_.find(event->watch);
        const bool concerns =
            (event->mask & kComes) == 0 || event->name.empty() ||
            (watched != watches_.end() && watched->second.count(std::string(event->name)) != 0);
        changed = changed || (concerns && event->mask != IN_IGNORED);  // the end of a watch
    }
    return changed;
}

void PlaceWatch::Set(const std::set<std::string>& paths) {
    Folders folders;
    for (const std::string& path : paths) {
        AddFoldersAbove(path, folders);
    }
    std::map<int, Names> watches;
    for (auto& [folder, names] : folders) {
        const int watch = inotify_.WatchPath(folder, names.empty() ? kGoes : kGoes | kComes);
        if (watch >= 0) {
            watches[watch] = std::move(names);
        }
    }
    for (const auto& [watch, names] : watches_) {
        if (watches.count(watch) == 0) {
            inotify_.Unwatch(watch);
        }
    }
    watches_ = std::move(watches);
}

void PlaceWatch::AddFoldersAbove(const std::string& path, Folders& folders) {
    std::string above;
    for (size_t end = 0; end < path.size();) {
        Names& names = folders[above.empty() ? "/" : above];
        const size_t begin = end + 1;
        end = std::min(path.find('/', begin), path.size());
        above = path.substr(0, end);
        if (access(above.c_str(), F_OK) != 0) {
            names.insert(path.substr(begin, end - begin));
            return;
        }
    }
}

}  // namespace zel_daemon

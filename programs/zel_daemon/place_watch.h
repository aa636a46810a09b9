#pragma once

#include <map>
#include <set>
#include <string>

#include "programs/zel_daemon/inotify.h"

namespace zel_daemon {

/// Notices that a path may lead to another folder than before, because a folder above it was
/// renamed, removed or made. What is mounted there, /proc/self/mountinfo tells.
///
/// Threads: one thread.
class PlaceWatch {
public:
    /// Where inotify cannot be had it notices nothing.
    PlaceWatch();

    /// Readable when something has happened; -1: never.
    int Fd() const { return inotify_.Fd(); }
    /// Takes that in. Whether a path may lead elsewhere. Set() has to follow then: another folder
    /// may be above one of them.
    bool Changed();

    /// Looks after these paths, in place of those before. What becomes of the folder at the end of
    /// a path is not noticed while it is there.
    void Set(const std::set<std::string>& paths);

private:
    using Names = std::set<std::string>;
    /// Each with the names that are waited for in it.
    using Folders = std::map<std::string, Names>;
    static void AddFoldersAbove(const std::string& path, Folders& folders);

    Inotify inotify_;
    std::map<int, Names> watches_;
};

}  // namespace zel_daemon

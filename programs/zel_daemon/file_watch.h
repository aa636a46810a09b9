#pragma once

#include <string>
#include <vector>

#include "programs/zel_daemon/inotify.h"

namespace zel_daemon {

/// Notices that one of some files in a folder is another one, or has been written.
class FileWatch {
public:
    /// Where inotify cannot be had it notices nothing.
    FileWatch(const std::string& folder, std::vector<std::string> names);

    /// Readable when something has happened in the folder; -1: never.
    int Fd() const { return watched_ ? inotify_.Fd() : -1; }
    /// Takes that in. Whether it may have been one of the files.
    bool Changed();

private:
    const std::vector<std::string> names_;
    Inotify inotify_;
    bool watched_ = false;
};

}  // namespace zel_daemon

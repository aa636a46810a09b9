#pragma once

#include <string>
#include <vector>

#include "base/unique_fd.h"

namespace zel_daemon {

/// Notices that one of some files in a folder is another one, or has been written.
class FileWatch {
public:
    /// Where inotify cannot be had it notices nothing.
    FileWatch(const std::string& folder, std::vector<std::string> names);

    /// Readable when something has happened in the folder; -1: never.
    int Fd() const { return fd_.Get(); }
    /// Takes that in. Whether it may have been one of the files.
    bool Changed();

private:
    const std::vector<std::string> names_;
    base::UniqueFd fd_;
};

}  // namespace zel_daemon

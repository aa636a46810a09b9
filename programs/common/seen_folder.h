// Whether a path is the same folder to two processes: each may have its own mounts, or its own
// /tmp.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace programs {

/// A folder as one process sees it. Device and inode number identify it until the next reboot.
struct SeenFolder {
    uint64_t device = 0;
    uint64_t inode = 0;
    std::string volume;  ///< the mount point of its volume
};

/// The folder at `path`; nothing, with errno set, when it is not a folder or cannot be read.
std::optional<SeenFolder> LookAtFolder(const std::string& path);

/// How the folder at `path` differs for this process from what another process has `seen` there:
/// "it cannot read it: ..."; empty when it is the same for both.
std::string DifferenceFrom(const SeenFolder& seen, const std::string& path);

}  // namespace programs

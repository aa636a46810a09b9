// Whether two processes that name a folder mean the same one: each may have mounts, or a /tmp, of
// its own.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace programs {

/// A folder as one process sees it. The numbers are the running kernel's, and tell folders apart
/// until its end.
struct SeenFolder {
    uint64_t device = 0;
    uint64_t inode = 0;
    std::string volume;  ///< where its volume is mounted
};

/// The folder at `path`; nothing, with errno set, when it is none, or cannot be read.
std::optional<SeenFolder> LookAtFolder(const std::string& path);

/// What is different for this process about the folder that `seen` tells of, which another one sees
/// at `path`: "it cannot read it: ..."; empty when it is the same to both.
std::string DifferenceFrom(const SeenFolder& seen, const std::string& path);

}  // namespace programs

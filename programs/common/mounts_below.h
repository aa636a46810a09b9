// What is mounted below a share's folder: where a disk that was there is away, its part of the copy
// stays.
#pragma once

#include <string>
#include <vector>

namespace programs {

/// The mounts that this process sees, as they were when it was made. A place where nothing else is
/// to be seen than without the mount is none, nor is one at which an automounter waits.
class MountTable {
public:
    /// Throws Failure (kLocal) when the kernel's table cannot be read.
    MountTable();

    /// The mount points below `folder`, each as "/path" in the folder. Throws Failure (kLocal) when
    /// there is no such folder.
    std::vector<std::string> Below(const std::string& folder) const;

private:
    std::vector<std::string> points_;
};

/// Those that were seen below the share's folder by an earlier push and are not there now; what is
/// seen for the first time is noted. What `excludes` leave behind does not count. Throws Failure
/// (kLocal).
std::vector<std::string> MissingMounts(const std::string& share, const std::string& folder,
                                       const std::vector<std::string>& excludes = {});

/// `excludes` and what keeps all at or below these mount points from being sent or deleted, as
/// rsync patterns.
std::vector<std::string> Without(const std::vector<std::string>& away,
                                 std::vector<std::string> excludes);

/// The rsync pattern of exactly that path in a share.
std::string PatternOf(const std::string& path);

/// Whether `path` is `above` or lies below it; "/" is above all.
bool IsAtOrBelow(const std::string& path, const std::string& above);

}  // namespace programs

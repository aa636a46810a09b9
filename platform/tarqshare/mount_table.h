// The kernel's table of mounts, as /proc/self/mountinfo gives it.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

namespace tarq_share {

struct Mount {
    uint64_t id;
    uint64_t parent_id;  ///< the mount that this one lies on
    unsigned int major;  ///< the file system's device; major 0: no single block device behind it
    unsigned int minor;
    std::string root;  ///< which part of it is mounted: "/", but for bind mounts and subvolumes
    std::string mount_point;
    std::string type;    ///< "ext4", "nfs4", "fuse.sshfs"
    std::string source;  ///< "/dev/sda1", "nas:/export", "tmpfs": as the file system says it
};

/// Parses the table, in the order of the lines. Malformed lines are skipped.
std::vector<Mount> ParseMountTable(const std::string& text);

/// The mount that `real_path` (absolute, no links, no "..") lies on: the one with the kernel's
/// number when that is known, else the last one with the longest mount point in front of the path.
/// nullptr when there is none.
const Mount* FindMount(const std::vector<Mount>& table, const std::string& real_path,
                       std::optional<uint64_t> mount_id);

/// Whether `path` is `folder` or lies below it. Both absolute, without a slash at the end ("/"
/// excepted).
bool IsWithin(const std::string& path, const std::string& folder);

}  // namespace tarq_share

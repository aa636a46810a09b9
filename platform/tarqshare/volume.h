// Volumes: which file system a path lies on, what kind of storage that is, and how to know it
// again.
#pragma once

#include <optional>
#include <string>

namespace tarq_share {

/// Where the kernel and the device manager tell about mounts and disks.
struct HostFolders {
    std::string mount_table = "/proc/self/mountinfo";
    std::string sys = "/sys";
    std::string dev = "/dev";
    std::string udev_data = "/run/udev/data";
    bool kernel_mount_ids = true;  ///< false when the table is not the running kernel's
};

struct Volume {
    std::string mount_point;
    std::string file_system;  ///< its type: "ext4"
    std::string uuid;         ///< empty when nobody tells
    unsigned int type;        ///< TARQVolumeType
};

/// The volume that `path` lies on. Nothing, with errno set, when the path does not exist or lies on
/// no mount.
std::optional<Volume> FindVolume(const std::string& path, const HostFolders& host = {});

/// Whether `now` is the volume that was recorded. Of a file system whose UUID is not known at one
/// of the two times (it has none, or no device manager is in sight) its kind and its place are all
/// there is to go by.
bool IsSameVolume(const Volume& recorded, const Volume& now);

}  // namespace tarq_share

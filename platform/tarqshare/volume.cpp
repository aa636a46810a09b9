#include "platform/tarqshare/volume.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <tarq/share.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstdlib>
#include <filesystem>
#include <regex>
#include <sstream>

#include "base/text.h"
#include "base/whole_file.h"
#include "platform/tarqshare/mount_table.h"

namespace tarq_share {
namespace {

namespace fs = std::filesystem;

// Nobody stacks device mappings or file systems deeper than this.
constexpr int kMaxDepth = 16;

constexpr const char* kRemoteTypes[] = {
    "9p",
    "afs",
    "ceph",
    "cifs",
    "coda",
    "davfs",
    "fuse.ceph",
    "fuse.cephfs",
    "fuse.curlftpfs",
    "fuse.davfs2",
    "fuse.glusterfs",
    "fuse.gcsfuse",
    "fuse.gvfsd-fuse",
    "fuse.rclone",
    "fuse.s3fs",
    "fuse.smbnetfs",
    "fuse.sshfs",
    "glusterfs",
    "lustre",
    "ncpfs",
    "nfs",
    "nfs4",
    "orangefs",
    "smb3",
    "smbfs",
    "virtiofs",
};
// File systems in user space that combine local disks. Where others keep their data is not known.
constexpr const char* kLocalUserSpaceTypes[] = {"fuse.mergerfs", "fuse.mhddfs", "fuse.unionfs",
                                                "fuse.zfs", "fuseblk"};

template <size_t count>
bool Contains(const char* const (&list)[count], const std::string& text) {
    return std::find(std::begin(list), std::end(list), text) != std::end(list);
}

std::string RealPath(const std::string& path) {
    std::array<char, PATH_MAX> real;
    return realpath(path.c_str(), real.data()) == nullptr ? std::string() : real.data();
}

std::optional<uint64_t> KernelMountId(const std::string& path) {
    struct statx status {};
    if (statx(AT_FDCWD, path.c_str(), 0, STATX_MNT_ID, &status) != 0 ||
        (status.stx_mask & STATX_MNT_ID) == 0) {
        return std::nullopt;
    }
    return status.stx_mnt_id;
}

bool IsDirectory(const std::string& path) {
    std::error_code ignored;
    return fs::is_directory(path, ignored);
}

bool IsStackable(const Mount& mount) {
    return mount.major == 0 && !Contains(kRemoteTypes, mount.type) && !mount.source.empty() &&
           mount.source.front() == '/' && !IsWithin(mount.source, "/dev");
}

class Finder {
public:
    explicit Finder(const HostFolders& host)
        : host_(host), table_(ParseMountTable(base::ReadFile(host.mount_table).value_or(""))) {}

    /// The mount that holds the data of `path`: where a file system shows another folder's files
    /// (decrypted, say), that folder's.
    const Mount* DataMountOf(const std::string& path, int depth = 0) const {
        const std::string real = RealPath(path);
        if (real.empty()) {
            return nullptr;
        }
        const Mount* mount =
            FindMount(table_, real, host_.kernel_mount_ids ? KernelMountId(real) : std::nullopt);
        if (mount == nullptr) {
            errno = ENODEV;
            return nullptr;
        }
        if (!IsStackable(*mount) || depth == kMaxDepth) {
            return mount;
        }
        if (IsWithin(RealPath(mount->source), mount->mount_point)) {
            return ParentOf(*mount);  // laid over the very folder that it shows
        }
        return IsDirectory(mount->source) ? DataMountOf(mount->source, depth + 1) : mount;
    }

    Volume Describe(const Mount& mount) const {
        const fs::path disk = SysfsFolder(mount);
        return {mount.mount_point, mount.type, Uuid(disk), TypeOf(mount, disk)};
    }

private:
    const Mount* ParentOf(const Mount& mount) const {
        const Mount* parent = FindMount(table_, "", mount.parent_id);
        return parent == nullptr ? &mount : parent;
    }

    /// The kernel's folder of the block device behind a mount; empty when there is none.
    fs::path SysfsFolder(const Mount& mount) const {
        std::error_code error;
        if (mount.major != 0) {
            const fs::path folder =
                fs::canonical(host_.sys + "/dev/block/" + std::to_string(mount.major) + ":" +
                                  std::to_string(mount.minor),
                              error);
            return error ? fs::path() : folder;
        }
        // Subvolumes have a device number of no disk; the source names one of the file system's
        // disks.
        const std::string source = mount.source.substr(0, mount.source.find(':'));
        if (!IsWithin(source, "/dev")) {
            return {};
        }
        fs::path node = fs::canonical(source, error);
        if (error) {
            node = source;
        }
        const fs::path folder =
            fs::canonical(host_.sys + "/class/block/" + node.filename().string(), error);
        return error ? fs::path() : folder;
    }

    unsigned int TypeOf(const Mount& mount, const fs::path& disk) const {
        if (Contains(kRemoteTypes, mount.type)) {
            return TARQ_VOLUME_REMOTE;
        }
        if (!disk.empty()) {
            return IsExternal(disk, 0) ? TARQ_VOLUME_EXTERNAL : TARQ_VOLUME_INTERNAL;
        }
        const bool user_space = mount.type.compare(0, 4, "fuse") == 0;
        return user_space && !Contains(kLocalUserSpaceTypes, mount.type) ? TARQ_VOLUME_UNKNOWN
                                                                         : TARQ_VOLUME_INTERNAL;
    }

    /// Whether the disk, or any disk below a mapped one, can be taken away while the machine runs.
    bool IsExternal(fs::path disk, int depth) const {
        std::error_code error;
        if (fs::exists(disk / "partition", error)) {
            disk = disk.parent_path();
        }
        if (base::Trimmed(base::ReadFile(disk / "removable").value_or("")) == "1") {
            return true;
        }
        // Below the folder of `sys` alone: that folder's own name says nothing about the disk.
        const std::string position = disk.lexically_relative(RealPath(host_.sys));
        static const std::regex outside_bus("(^|/)(usb[0-9]+|fw[0-9]+)(/|$)");
        if (std::regex_search(position, outside_bus)) {
            return true;
        }
        // Of these devices, soldered memory reports the type "MMC", a removable card "SD".
        if (position.find("mmc_host/") != std::string::npos &&
            base::Trimmed(base::ReadFile(disk / "device/type").value_or("")) != "MMC") {
            return true;
        }
        if (depth == kMaxDepth) {
            return false;
        }
        fs::directory_iterator slave(disk / "slaves", error);
        for (; !error && slave != fs::directory_iterator(); slave.increment(error)) {
            const fs::path below = fs::canonical(slave->path(), error);
            if (!error && IsExternal(below, depth + 1)) {
                return true;
            }
        }
        return false;
    }

    /// The file system's UUID, from the device manager's database, else from its links. The
    /// database comes first, because of a file system's several disks only one has the link.
    std::string Uuid(const fs::path& disk) const {
        if (disk.empty()) {
            return {};
        }
        const std::string number(base::Trimmed(base::ReadFile(disk / "dev").value_or("")));
        std::istringstream properties(base::ReadFile(host_.udev_data + "/b" + number).value_or(""));
        static const std::string key = "E:ID_FS_UUID=";
        for (std::string line; std::getline(properties, line);) {
            if (line.compare(0, key.size(), key) == 0) {
                return line.substr(key.size());
            }
        }
        std::error_code error;
        fs::directory_iterator link(host_.dev + "/disk/by-uuid", error);
        for (; !error && link != fs::directory_iterator(); link.increment(error)) {
            std::error_code unreadable;
            if (fs::read_symlink(link->path(), unreadable).filename() == disk.filename()) {
                return link->path().filename();
            }
        }
        return {};
    }

    const HostFolders host_;
    const std::vector<Mount> table_;
};

}  // namespace

std::optional<Volume> FindVolume(const std::string& path, const HostFolders& host) {
    const Finder finder(host);
    const Mount* mount = finder.DataMountOf(path);
    if (mount == nullptr) {
        return std::nullopt;
    }
    return finder.Describe(*mount);
}

bool IsSameVolume(const Volume& recorded, const Volume& now) {
    const auto agree = [](const std::string& a, const std::string& b) {
        return a.empty() || b.empty() || a == b;
    };
    return recorded.mount_point == now.mount_point &&
           agree(recorded.file_system, now.file_system) && agree(recorded.uuid, now.uuid);
}

}  // namespace tarq_share

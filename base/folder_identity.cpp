#include "base/folder_identity.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <sys/stat.h>
#include <sys/vfs.h>

#include <algorithm>
#include <array>
#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <iterator>

namespace base {
namespace {

constexpr uint32_t kZfsMagic = 0x2fc12fc1;
constexpr uint32_t kBcachefsMagic = 0xca451a4e;
constexpr uint32_t kJfsMagic = 0x3153464a;

/// Which facts of a kind of file system outlast its mount.
struct Lasting {
    uint32_t magic;
    bool id;
    bool inode;
    bool birth;
};

// Where the file system's id is derived from the device number, it only tells in which order disks
// were found. Overlays number some folders anew at each mount. File systems in memory do not
// outlast their mount: there, any difference means another folder. For kinds that are not listed
// (FAT and most file systems in user space make up inode numbers) only the kind itself is compared.
constexpr Lasting kLasting[] = {
    {EXT4_SUPER_MAGIC, true, true, true},  // and its two elders
    {XFS_SUPER_MAGIC, false, true, true},
    {BTRFS_SUPER_MAGIC, true, true, true},
    {F2FS_SUPER_MAGIC, false, true, true},
    {kZfsMagic, true, true, true},
    {kBcachefsMagic, true, true, true},
    {kJfsMagic, true, true, false},
    {TMPFS_MAGIC, true, true, true},
    {RAMFS_MAGIC, false, true, false},
    {OVERLAYFS_SUPER_MAGIC, false, false, true},
};

Lasting LastingFactsOf(uint32_t magic) {
    const auto* const known =
        std::find_if(std::begin(kLasting), std::end(kLasting),
                     [&](const Lasting& kind) { return kind.magic == magic; });
    return known == std::end(kLasting) ? Lasting{magic, false, false, false} : *known;
}

std::string Hex(uint64_t number, int digits) {
    std::array<char, 17> text;
    snprintf(text.data(), text.size(), "%0*" PRIx64, digits, number);
    return text.data();
}

std::string Moment(const statx_timestamp& time) {
    std::array<char, 40> text;
    snprintf(text.data(), text.size(), "%" PRId64 ".%09" PRIu32, static_cast<int64_t>(time.tv_sec),
             static_cast<uint32_t>(time.tv_nsec));
    return text.data();
}

}  // namespace

std::optional<FolderIdentity> IdentityOf(int folder) {
    struct statfs system {};
    struct statx file {};
    if (fstatfs(folder, &system) != 0 ||
        statx(folder, "", AT_EMPTY_PATH, STATX_INO | STATX_BTIME, &file) != 0) {
        return std::nullopt;
    }
    const auto magic = static_cast<uint32_t>(system.f_type);
    const Lasting lasting = LastingFactsOf(magic);
    const uint64_t id = static_cast<uint64_t>(static_cast<uint32_t>(system.f_fsid.__val[0])) << 32 |
                        static_cast<uint32_t>(system.f_fsid.__val[1]);
    FolderIdentity identity;
    identity.file_system = Hex(magic, 1);
    if (lasting.id && id != 0) {
        identity.file_system_id = Hex(id, 16);
    }
    if (lasting.inode && (file.stx_mask & STATX_INO) != 0) {
        identity.inode = std::to_string(file.stx_ino);
    }
    // A time of 0 means that none was recorded.
    if (lasting.birth && (file.stx_mask & STATX_BTIME) != 0 && file.stx_btime.tv_sec != 0) {
        identity.birth = Moment(file.stx_btime);
    }
    return identity;
}

bool IsSameIdentity(const FolderIdentity& recorded, const FolderIdentity& now) {
    const auto agree = [](const std::string& a, const std::string& b) {
        return a.empty() || b.empty() || a == b;
    };
    return agree(recorded.file_system, now.file_system) &&
           agree(recorded.file_system_id, now.file_system_id) && agree(recorded.inode, now.inode) &&
           agree(recorded.birth, now.birth);
}

}  // namespace base

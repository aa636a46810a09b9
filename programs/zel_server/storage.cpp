#include "programs/zel_server/storage.h"

#include <pwd.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>

namespace zel_server {

namespace {

namespace fs = std::filesystem;

// The overflow uid: how an unprivileged container sees files of users outside of it.
constexpr uid_t kSomebodyOutside = 65534;

std::string OctalMode(mode_t mode) {
    char text[16];
    snprintf(text, sizeof text, "%o", static_cast<unsigned int>(mode & 07777));
    return text;
}

std::string UserNumber(uid_t uid) {
    return "the user number " + std::to_string(uid);
}

// Why other users could rename entries of `folder`, an ancestor of a storage folder; empty when
// none can.
std::string WhyChangeable(const std::string& folder, const ServerConfig& config,
                          const CopiesOwner& owner) {
    struct stat info = {};
    if (stat(folder.c_str(), &info) != 0) {
        return "";  // nobody can reach anything through it
    }
    const bool trusted = info.st_uid == 0 || info.st_uid == owner.uid ||
                         (config.user.empty() && info.st_uid == kSomebodyOutside);
    if (!trusted) {
        return folder + ", on its way, belongs to " + UserNumber(info.st_uid);
    }
    const bool group_may =
        (info.st_mode & S_IWGRP) != 0 && info.st_gid != 0 && info.st_gid != owner.gid;
    if ((group_may || (info.st_mode & S_IWOTH) != 0) && (info.st_mode & S_ISVTX) == 0) {
        return folder + ", on its way, may be changed by others (mode " + OctalMode(info.st_mode) +
               ")";
    }
    return "";
}

std::string WhyAnyAboveChangeable(const std::string& path, const ServerConfig& config,
                                  const CopiesOwner& owner) {
    for (std::string folder = FolderAbove(path);; folder = FolderAbove(folder)) {
        std::string why = WhyChangeable(folder, config, owner);
        if (!why.empty() || folder == "/") {
            return why;
        }
    }
}

std::string NoOwner(const ServerConfig& config) {
    return "there is no user '" + config.user + "', to whom it is to belong";
}

}  // namespace

std::string FolderAbove(const std::string& path) {
    const size_t slash = path.rfind('/');
    return slash == 0 || slash == std::string::npos ? "/" : path.substr(0, slash);
}

StorageState CheckStorage(const ServerConfig& config, const std::string& folder) {
    struct stat info = {};
    if (stat(folder.c_str(), &info) != 0) {
        return errno == EACCES ? StorageState::kNotPermitted : StorageState::kAbsent;
    }
    // When a storage disk is not mounted, its empty mount point remains, on another disk: nothing
    // may be written there.
    if (!IsOnRecordedDisk(folder)) {
        return StorageState::kOtherDisk;
    }
    if (!S_ISDIR(info.st_mode)) {
        return StorageState::kAbsent;
    }
    if (!WhyOpen(config, folder).empty()) {
        return StorageState::kOpen;
    }
    if (access(folder.c_str(), W_OK | X_OK) != 0) {
        return errno == EROFS ? StorageState::kReadOnly : StorageState::kNotPermitted;
    }
    return config.without_attributes || KeepsAttributes(folder) ? StorageState::kReady
                                                                : StorageState::kNoAttributes;
}

std::optional<CopiesOwner> OwnerOfCopies(const ServerConfig& config) {
    if (config.user.empty()) {
        return CopiesOwner{geteuid(), getegid()};
    }
    const struct passwd* const user = getpwnam(config.user.c_str());
    return user != nullptr ? std::optional<CopiesOwner>({user->pw_uid, user->pw_gid})
                           : std::nullopt;
}

std::string WhyOpen(const ServerConfig& config, const std::string& folder) {
    const auto owner = OwnerOfCopies(config);
    struct stat info = {};
    if (!owner) {
        return NoOwner(config);
    }
    if (lstat(folder.c_str(), &info) != 0) {
        return "";
    }
    if (S_ISLNK(info.st_mode)) {
        return "is a symbolic link";
    }
    if (info.st_uid != owner->uid) {
        return "belongs to " + UserNumber(info.st_uid);
    }
    if ((info.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
        return "may be entered by others (mode " + OctalMode(info.st_mode) + ")";
    }
    return WhyReplaceable(config, folder);
}

std::string WhyReplaceable(const ServerConfig& config, const std::string& folder) {
    const auto owner = OwnerOfCopies(config);
    if (!owner) {
        return NoOwner(config);
    }
    // For symbolic links, both the folder of the link and the folder of its target are checked.
    const std::string why = WhyAnyAboveChangeable(folder, config, *owner);
    std::error_code error;
    const std::string real = fs::weakly_canonical(folder, error);
    return !why.empty() || error || real == folder ? why
                                                   : WhyAnyAboveChangeable(real, config, *owner);
}

bool KeepsAttributes(const std::string& folder) {
    // Reading a missing attribute tells whether attributes are supported, and changes nothing.
    return getxattr(folder.c_str(), "user.zel.probe", nullptr, 0) >= 0 || errno != ENOTSUP;
}

}  // namespace zel_server

// The storage folders: whether they are usable, and whether others are kept out of them.
//
// Copies keep the modes that their files have on the client, so the folder above must be closed: it
// belongs to the user of the copies, and only that user can enter it.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// The state of a storage folder. kOtherDisk: not on the disk that was recorded at set-up; kOpen:
/// others can access its contents; kNoAttributes: owners and modes cannot be stored there.
enum class StorageState {
    kReady,
    kAbsent,
    kOtherDisk,
    kOpen,
    kReadOnly,
    kNotPermitted,
    kNoAttributes
};
StorageState CheckStorage(const ServerConfig& config, const std::string& folder);

/// Who owns the copies and the folders above them.
struct CopiesOwner {
    uid_t uid = 0;
    gid_t gid = 0;
};
/// Nothing when there is no such user.
std::optional<CopiesOwner> OwnerOfCopies(const ServerConfig& config);

/// Why others can access the contents of `folder`: "belongs to the user number 1000", "may be
/// entered by others (mode 755)"... Empty when only root and the user of the copies can.
std::string WhyOpen(const ServerConfig& config, const std::string& folder);
/// The part of WhyOpen() that concerns the folders above: why others could replace `folder` by
/// another one.
std::string WhyReplaceable(const ServerConfig& config, const std::string& folder);

/// Whether files there can have extended attributes, which store owners, modes and special files.
bool KeepsAttributes(const std::string& folder);

/// The parent folder of `path`.
std::string FolderAbove(const std::string& path);

}  // namespace zel_server

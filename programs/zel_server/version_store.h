// Where a share's versions lie: the files that pushes have replaced or deleted, as they were.
//
//     STORAGE/photos/.zel_versions/ID          while the connection that replaces them runs
//     STORAGE/.versions/photos/TIME-ID/...     when it has ended; by their paths in the share
//
// ID is random for each run (base::RandomDigits()). TIME, YYYYMMDDTHHMMSS.NNNNNNNNN in
// UTC, is when the connection ended. A version at path P in the folder of TIME is what stood at P
// until TIME, and since the birth time of its file. So what stood at P at any time T is the version
// in the first folder whose TIME is later than T or, without one, what stands in the copy: if it
// was born by then; otherwise there was nothing at P.
//
// The versions lie beside the copies, on the same file system, so that one rename takes a folder
// there, and below the closed storage folder, where no module of the rsync daemon reaches.
//
// Nothing else spells this layout.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <tuple>
#include <vector>

#include "base/random_digits.h"
#include "base/unique_fd.h"
#include "tarq/rsync_wrapper.h"

namespace zel_server {

/// A moment in UTC, to the nanosecond.
struct VersionTime {
    int64_t seconds = 0;  ///< since the epoch
    int32_t nanoseconds = 0;

    static VersionTime Now();

    bool operator<(const VersionTime& other) const {
        return std::tie(seconds, nanoseconds) < std::tie(other.seconds, other.nanoseconds);
    }
    bool operator==(const VersionTime& other) const {
        return seconds == other.seconds && nanoseconds == other.nanoseconds;
    }
};

/// What one connection has replaced or deleted.
struct VersionFolder {
    VersionTime time;  ///< when the connection ended
    std::string id;    ///< the run's
    std::string path;  ///< of the folder

    /// By time; of one time, by ID, as their names sort.
    bool operator<(const VersionFolder& other) const {
        return std::tie(time, id) < std::tie(other.time, other.id);
    }
};

/// Whether `text` can be a run's ID.
inline bool IsVersionId(const std::string& text) {
    return base::AreRandomDigits(text);
}

/// "1763820000.123456789": seconds since the epoch.
std::string TimeText(const VersionTime& time);
/// Takes fewer decimals, too. Nothing for any other text.
std::optional<VersionTime> ParseTimeText(const std::string& text);

/// "20261122T142800.123456789-ID", the name of a folder of versions.
std::string VersionName(const VersionTime& time, const std::string& id);
/// `path` is left empty. Nothing for a text that VersionName() does not make.
std::optional<VersionFolder> ParseVersionName(const std::string& name);

/// The folder at the root of each copy that runs write their versions into. Its name is reserved:
/// no share has an entry of that name at its root.
inline constexpr const char* kVersionsInCopy = TARQ::Backup::kVersionsFolder;
/// COPY/.zel_versions. `copy`: the folder of the share's copy, ShareState::path.
std::string VersionsLeftIn(const std::string& copy);

/// STORAGE/.versions, for all shares whose copies lie in the folder `storage`.
std::string VersionsBelow(const std::string& storage);
/// STORAGE/.versions/KEY: the folder of the versions of `share`, whose copy lies at `copy`. It may
/// not exist yet. KEY is ModuleKey(share), of which no two shares have the same.
std::string VersionsOf(const std::string& share, const std::string& copy);

/// That folder, made when it is not there; not open, with errno set, when it cannot be.
base::UniqueFd HaveVersions(const std::string& share, const std::string& copy);

/// The versions in `folder` (VersionsOf()), the oldest first; none when there is no such folder.
/// Entries of other names are left out. Nothing, with errno set, when it cannot be read.
std::optional<std::vector<VersionFolder>> ListVersions(const std::string& folder);

/// Held shared by who reads a share's versions, so that what he has listed stays, and alone by who
/// gives some up. New ones may come meanwhile.
class VersionsLock {
public:
    /// `folder`: VersionsOf(). `how`: of flock(2). Not held, with errno set: ENOENT when there are
    /// none, EWOULDBLOCK with LOCK_NB when another one has it.
    VersionsLock(const std::string& folder, int how);
    explicit operator bool() const { return static_cast<bool>(folder_); }
    /// The folder, which is open.
    int Folder() const { return folder_.Get(); }

private:
    base::UniqueFd folder_;
};

}  // namespace zel_server

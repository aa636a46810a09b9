// What was moved within a share's copy, and when.
//
//     STORAGE/.versions/KEY/moves     a line each: TIME FROM TO .
//     STORAGE/.versions/KEY/moving    those that are being made: TIME FROM TO INODE BIRTH .
//
// A file's life at its path is in its inode's birth time and in the folder of versions that it went
// to (version_store.h). A rename changes neither, so what stood at a path before it is found by the
// list of renames alone: whatever is made of the names of one time and another goes through
// MovedNames.
//
// Each move is on the disk before it is made, and its outcome before anything else may change in
// the copy: what a crash has left open is decided by where the file is. A move never replaces
// anything, follows no link, and leads neither out of the share nor into a name that is reserved.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "programs/zel_server/moved_names.h"
#include "programs/zel_server/version_store.h"

namespace zel_server {

struct RecordedMove {
    VersionTime time;
    std::string from;  ///< relative to the share, as is `to`
    std::string to;
};

/// The moves of the share whose versions are in `folder` (VersionsOf()), the first first. Nothing,
/// with errno set, when that cannot be known: EBUSY while SettleMoves() is owed. They stay while a
/// VersionsLock is held.
std::optional<std::vector<RecordedMove>> ListMoves(const std::string& folder);

/// Makes these moves in the share's copy, in their order, as far as they can be made: nothing is
/// overwritten. Folders above a new place are made. Says of each whether it was made. REQUIRES
/// programs::IsMovableInShare() of all paths, and that no transfer into the share is running and
/// TakeVersions() has left nothing. Called with the registry's lock held.
std::vector<bool> MakeMoves(const std::string& share, const std::string& copy,
                            const std::vector<std::pair<std::string, std::string>>& moves);

/// Before anything is changed in the copy, or a time of its past is read: finishes the list of
/// moves after a crash. False, with errno set, when it cannot. Called with the registry's lock
/// held.
bool SettleMoves(const std::string& share, const std::string& copy);

/// Forgets the moves before that time. False, with errno set, when it cannot. REQUIRES a
/// VersionsLock for oneself.
bool ForgetMoves(const std::string& folder, const VersionTime& before);

/// Takes the names of one time, and then those of later and later ones.
class NamesOverTime {
public:
    /// `moves`, which outlives this: all of the share.
    NamesOverTime(const std::vector<RecordedMove>& moves, const VersionTime& since);

    /// The names as they were then and at `until`, which is no earlier than that of the call
    /// before.
    const MovedNames& Until(const VersionTime& until);
    /// As they are now.
    const MovedNames& UntilNow();

private:
    const std::vector<RecordedMove>& moves_;
    size_t next_ = 0;
    MovedNames names_;
};

}  // namespace zel_server

// What this machine has noted of its shares and of their copies, for the next push.
//
// A small file for each share, in /usr/tarq/etc/zel_shares, replaced atomically: the daemon and
// `zelctl push` share it. Whoever loses it loses nothing but knowledge: all is compared once.
#pragma once

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

namespace programs {

/// A copy that this machine has completed.
struct KnownCopy {
    std::string identity;
    uint64_t generation = 0;  ///< as of the last push that this machine completed
    std::string push;         ///< the mark of the last push of this machine
};

struct ShareNotes {
    std::vector<KnownCopy> copies;    ///< the one that was pushed last comes last
    std::vector<std::string> begun;   ///< marks of pushes of which it is not noted how they ended
    std::vector<std::string> mounts;  ///< mount points seen below the share, each "/path" in it
    /// Paths ("photos/a.mov") of the files that pushes were sending when they broke, the last
    /// first.
    std::vector<std::string> sending;
    std::string gone_on;  ///< identity of the copy with which others have gone on; empty: of none
};

/// Throws Failure (kLocal) when there is a file that cannot be read.
ShareNotes ReadShareNotes(const std::string& share);
/// Reads, changes and durably writes the notes of a share, under a lock. Throws Failure (kLocal).
void ChangeShareNotes(const std::string& share, const std::function<void(ShareNotes&)>& change);
/// Forgets everything about a share.
void RemoveShareNotes(const std::string& share);

}  // namespace programs

// The copy of a share as a push finds it: which one it is, and whether it is still the one that the
// client has left.
#pragma once

#include <string>

#include "programs/zel_server/command.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/share_record.h"

namespace zel_server {

/// Whether a folder is the one in which the copy began.
enum class CopyFolder {
    kSame,
    kGone,     ///< nothing is there
    kAnother,  ///< another disk is mounted there, or the folder was made anew
    kUnread    ///< it cannot be looked at, or is no folder
};
/// A copy that has no identity yet is the same in any folder.
CopyFolder LookAtCopy(const CopyState& copy, const std::string& path);

/// What a push finds.
enum class CopyFound {
    kReady,
    kNobodys,  ///< there are files, and nothing tells whose they are
    kFailed
};
/// Finds the copy of a share at `path`, makes its folder when it is missing, and gives it a new
/// identity when it is not the one that `copy` describes: that is logged. `is_known`: the registry
/// or a record tells of the share. Called with the registry's lock held; records nothing.
CopyFound TakeCopy(const ServerConfig& config, const std::string& share, const std::string& path,
                   bool is_known, CopyState& copy);

/// Whether a start command comes from a client that has not taken part in what became of the copy:
/// it knows the copy, but others have pushed into it since. A copy that is older than the client
/// knows is none: the client compares it whole.
bool HasGoneOnWithout(const CopyState& copy, const Command& start);

/// Whether a start command tells of a later state of this very copy.
bool KnowsLater(const CopyState& copy, const Command& start);

/// What a client is told of the copy.
std::string CopyAnswer(const CopyState& copy);

}  // namespace zel_server

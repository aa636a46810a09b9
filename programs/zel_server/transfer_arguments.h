// The arguments of the rsync runs that this server accepts: exactly those that the client of this
// service uses. All others are refused, harmless or not.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/share_module.h"

namespace zel_server {

/// A run that is accepted.
struct Transfer {
    /// kWrite pushes into the module, kCompare lists what a push would change, kRead sends from it.
    Access does = Access::kRead;
    bool by_content = false;  ///< it reads every file, which takes long and need not be quick
    /// The ID of its own folders: for what it replaces or deletes, and for files that are not
    /// complete. A run that writes has one.
    std::string id;
    /// It goes on with a partial file that stands beside the file.
    bool resumes = false;
};

/// What a run with these arguments does. `words`: the arguments of the server's rsync, without the
/// program name. Nothing for a run that is refused, with the reason for a person in `why`.
std::optional<Transfer> JudgeTransfer(const std::vector<std::string>& words, std::string& why);

}  // namespace zel_server

// What little is to be sent of a folder that was moved, as the server moves it, too.
#pragma once

#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "base/unique_fd.h"
#include "programs/common/run_result.h"
#include "programs/zel_daemon/file_index.h"

namespace zel_daemon {

/// The moves with which no other has to do, by their place among all: both their ends are what they
/// were before and after all of them.
std::set<size_t> AloneIn(const std::vector<programs::ShareMove>& moves);

/// What was seen of a folder that was moved.
struct MovedFolder {
    /// To be sent, so that the copy has it as it is; none: all of it.
    std::vector<std::string> files;
    /// The whole folder, as a ChunkWriter has put it together; `files` is empty where that is more
    /// than so many bytes.
    std::string entries;
};

/// Compares a folder that was moved with what the index has at its old place, which the copy has,
/// too: see ShareMove::instead. `folder`: the share's.
MovedFolder LookAtMoved(FileIndex& index, const std::string& folder,
                        const programs::ShareMove& move, size_t most_bytes,
                        const std::function<bool()>& cancelled);

/// A file below a folder that was moved and is otherwise as the index has it at its old place: see
/// ShareMove::is_untouched. Nothing when there is none, or the folder is another one.
std::optional<std::string> FileOfUntouched(FileIndex& index, const base::UniqueFd& share,
                                           const programs::ShareMove& move);

}  // namespace zel_daemon

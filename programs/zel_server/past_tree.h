// The tree of a share's copy as it stood at a time, for reading: folders of its own, filled with
// hard links to the files of the copy and to their versions (version_store.h).
//
//     STORAGE/.restores/NAME/...     0700 above; NAME is the module's, without its dot
//
// Nothing is copied, and it costs in proportion to the part that is asked for. A tree lives as long
// as the module in which it is read; what a crash has left goes with the next RemovePastTrees().
//
// What is read here was written by clients: nothing follows a symbolic link, and every name is
// looked up in a folder that is held open.
#pragma once

#include <functional>
#include <string>

#include "base/unique_fd.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/version_store.h"

namespace zel_server {

/// The part of a copy that is wanted, and as of when.
struct PastTreeOrder {
    std::string share;
    std::string copy;  ///< the share's folder, ShareState::path; it may be gone
    std::string path;  ///< below it, relative, without "..", "." and empty names; empty: all
    VersionTime at;
};

enum class PastTreeResult {
    kMade,
    kNothing,      ///< nothing stood there
    kNoBirthTimes  ///< the file system does not say when a file was made
};

/// The folder of the tree `name` of a share whose copy is in `storage`.
std::string PastTreePath(const std::string& storage, const std::string& name);

/// Makes the tree. While `made` is open, RemovePastTrees() leaves the tree alone. Only kMade leaves
/// a tree. Throws std::system_error.
PastTreeResult MakePastTree(const ServerConfig& config, const PastTreeOrder& order,
                            const std::string& name, base::UniqueFd& made);

/// Removes all trees that are neither being made nor, as `is_open` says, read.
void RemovePastTrees(const ServerConfig& config,
                     const std::function<bool(const std::string& name)>& is_open);

}  // namespace zel_server

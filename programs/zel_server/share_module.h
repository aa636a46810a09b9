// A share's folder and its module of the rsync daemon: one file each in shares.d.
//
// The file also names, in comments, whom the share belongs to. So what the registry says of a share
// can be made again when it is lost, and a share that was lost is told from one that is new.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/registry.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Makes a share's folder, if it is not there yet, for the user that owns the copies.
bool MakeShareFolder(const ServerConfig& config, const std::string& path);

/// Writes the module of a share, if it is not there already word for word. The daemon knows it from
/// the next connection on. Only behind the share's section in the registry: a module without one
/// means that the section was lost.
bool WriteShareModule(const ServerConfig& config, const std::string& share,
                      const ShareState& state);

/// Whether the share has a module.
bool HasShareModule(const std::string& share);

/// What a module tells.
struct ShareModule {
    std::string module;
    std::string path;
    bool names_owner = false;  ///< false for one that an earlier version wrote
    std::string account;       ///< empty, as the client: nobody's
    std::string client;
};

/// Nothing when the file cannot be read, or is none of WriteShareModule's.
std::optional<ShareModule> ReadShareModule(const std::string& share);

/// The shares that have a module, sorted; nothing when the folder cannot be read.
std::optional<std::vector<std::string>> SharesWithModule();

}  // namespace zel_server

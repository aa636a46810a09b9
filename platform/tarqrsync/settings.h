#pragma once

#include <list>
#include <optional>
#include <string>

#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// What the setters of a wrapper have said. The meanings and defaults are theirs.
struct Settings {
    bool delete_missing = false;
    bool deletes_changes = false;  ///< RunOptions::deletes_changes, as far as anything is deleted
    bool numeric_ids = false;
    bool account = false;
    bool account_required = false;
    bool pseudo_root = false;
    bool ssh = false;
    bool compress = false;
    bool delta_copy = false;
    bool list_only = false;
    bool relative_path = false;
    bool acl = false;
    bool debug_log = false;
    int port = 0;
    int timeout = 0;  ///< seconds

    bool is_command = false;
    std::list<std::string> command;
    std::list<std::string> exclude_rules;
    std::string source;

    std::string user;
    std::string host;
    std::string password;
    std::string module;
    std::string sub_path;
    std::optional<PullOptions> pull;
};

/// Whether `host` is a name or an address, and safe to put in an argument list.
bool IsHost(const std::string& host);

/// Why these settings cannot be run, for a person; empty when they can. Whatever is let through is
/// safe to put in an argument list.
std::string RefusalOf(const Settings& settings);

/// The same of the paths in the options.
std::string RefusalOf(const RunOptions& options);

/// The value of the line outfile="..." of a command; empty when it has none.
std::string OutfileOf(const std::list<std::string>& command);

}  // namespace Backup
}  // namespace TARQ

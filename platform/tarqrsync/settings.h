#pragma once

#include <list>
#include <string>

namespace TARQ {
namespace Backup {

/// What the setters of a wrapper have said. The meanings and defaults are theirs.
struct Settings {
    bool delete_missing = false;
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
};

/// The way to the server.
enum class Transport {
    DAEMON,             ///< straight to the rsync daemon
    DAEMON_OVER_SSH,    ///< to the same daemon, through a connection that ssh forwards
    DIRECTORY_OVER_SSH  ///< to an rsync that ssh starts: a directory, no module
};

/// A module that begins with "/" is a directory; a command always goes to the daemon.
Transport TransportOf(const Settings& settings);

/// Why these settings cannot be run, for a person; empty when they can. Whatever is let through is
/// safe to put in an argument list.
std::string RefusalOf(const Settings& settings);

/// The value of the line outfile="..." of a command; empty when it has none.
std::string OutfileOf(const std::list<std::string>& command);

}  // namespace Backup
}  // namespace TARQ

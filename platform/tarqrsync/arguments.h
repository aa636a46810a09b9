#pragma once

#include <string>
#include <vector>

#include "base/rsync_config.h"
#include "platform/tarqrsync/private_folder.h"
#include "platform/tarqrsync/route.h"
#include "platform/tarqrsync/secret_file.h"
#include "platform/tarqrsync/settings.h"
#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// How one rsync is called.
struct Invocation {
    std::vector<std::string> arguments;    ///< without the program's own name
    std::vector<std::string> environment;  ///< NAME=value
    std::string input;                     ///< standard input: the daemon's password
    std::vector<SecretFile> secrets;       ///< that they name, as long as this lives
};

/// What starts an entry's line on rsync's output.
constexpr char kChangeMark[] = "@@ ";

/// Beside the settings, what decides how rsync is called.
struct InvocationContext {
    const Settings& settings;
    const Route& route;
    const base::RsyncConfig& config;
    const RunOptions& options;
    bool acls = false;            ///< ask for access control lists
    bool xattrs = false;          ///< ask for extended attributes
    std::string log_file;         ///< empty: none
    std::string versions = {};    ///< ID of the run that keeps versions; empty: it keeps none
    std::string start_file = {};  ///< with the lines of RunOptions::start; empty: none
};

/// Seconds that a connection may take to come up.
int ConnectTimeout(const Settings& settings);

/// A copy, or a listing, of files. Long lists of rules go to a file in `folder`. Throws
/// PrivateFileError and ServersError.
Invocation CopyInvocation(const InvocationContext& context, PrivateFolder* folder);

/// A server command, whose bytes lie in `command_file`: the answer `session` comes to
/// `answer_file`. Throws as CopyInvocation() does.
Invocation CommandInvocation(const InvocationContext& context, const std::string& command_file,
                             const std::string& session, const std::string& answer_file);

/// Only what a run needs: neither the host's own RSYNC_* and locale nor a ~/.popt changes how rsync
/// reads its options, and no other secret of the host's reaches the server's side by way of ssh's
/// SendEnv.
std::vector<std::string> BaseEnvironment();

/// Where programs are looked for.
std::string SearchPath();

/// `words` as one text that rsync's --rsh option takes apart into them again.
std::string QuoteForRsh(const std::vector<std::string>& words);

/// `words` as one text that a shell takes apart into them again.
std::string QuoteForShell(const std::vector<std::string>& words);

}  // namespace Backup
}  // namespace TARQ

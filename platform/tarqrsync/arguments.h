#pragma once

#include <string>
#include <vector>

#include "base/rsync_config.h"
#include "platform/tarqrsync/private_folder.h"
#include "platform/tarqrsync/settings.h"
#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// How one rsync is called.
struct Invocation {
    std::vector<std::string> arguments;    ///< without the program's own name
    std::vector<std::string> environment;  ///< NAME=value
    std::string input;                     ///< standard input: the daemon's password
};

/// What starts an entry's line on rsync's output.
constexpr char kChangeMark[] = "@@ ";

/// Beside the settings, what decides how rsync is called.
struct InvocationContext {
    const Settings& settings;
    const base::RsyncConfig& config;
    const RunOptions& options;
    bool acls = false;     ///< ask for access control lists
    bool xattrs = false;   ///< ask for extended attributes
    std::string log_file;  ///< empty: none
};

/// Seconds that a connection may take to come up.
int ConnectTimeout(const Settings& settings);

/// A copy, or a listing, of files. Long lists of rules and what ssh needs to log in go to files in
/// `folder`. Throws PrivateFileError.
Invocation CopyInvocation(const InvocationContext& context, PrivateFolder* folder);

/// A server command, whose bytes lie in `command_file`: the answer `session` comes to
/// `answer_file`.
Invocation CommandInvocation(const InvocationContext& context, const std::string& command_file,
                             const std::string& session, const std::string& answer_file,
                             PrivateFolder* folder);

/// `words` as one text that rsync's --rsh option takes apart into them again.
std::string QuoteForRsh(const std::vector<std::string>& words);

/// `words` as one text that a shell takes apart into them again.
std::string QuoteForShell(const std::vector<std::string>& words);

}  // namespace Backup
}  // namespace TARQ

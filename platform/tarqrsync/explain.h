#pragma once

#include <string>
#include <vector>

#include "base/rsync_config.h"
#include "platform/tarqrsync/route.h"
#include "platform/tarqrsync/settings.h"
#include "tarq/rsync_wrapper.h"

namespace TARQ {
namespace Backup {

/// What is known of an rsync that failed.
struct RunFacts {
    const Settings& settings;
    const Route& route;
    const base::RsyncConfig& config;
    int exit_code;         ///< rsync's own
    std::string messages;  ///< what rsync and ssh wrote, see MessageKeeper
};

/// What a failure comes to.
struct Verdict {
    int status;  ///< what execute() returns
    RunCause cause;
    std::string first_line;  ///< the failure in plain words, without a newline
};

/// Tells from rsync's and ssh's own words what went wrong. The status is rsync's exit code except
/// where a run over ssh, or a server that takes no commands, ends with a code that says less than
/// the words do.
Verdict Judge(const RunFacts& facts);

/// What rsync says, in a copy that could not read all of its source, that it could not copy:
/// relative to the source, a folder that ends in "/". `all`: nothing else is missing.
std::vector<std::string> IncompleteEntries(const RunFacts& facts, bool* all);

/// What the far end could not take of the extended attributes and access control lists of a copy.
struct RefusedAttributes {
    bool acls = false;
    bool xattrs = false;
};

/// Looks for it in the words of a run that failed.
RefusedAttributes FindRefusedAttributes(const RunFacts& facts);

}  // namespace Backup
}  // namespace TARQ

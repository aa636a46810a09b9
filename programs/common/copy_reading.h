// Copies at the server that are compared or listed, and not changed. Failures are thrown as
// RunFailure.
#pragma once

#include <functional>
#include <optional>
#include <string>

#include "programs/common/server_session.h"
#include "programs/common/task_run.h"

namespace programs {

/// Requests a module in which a dry run may compare the share ("compare"), or from which it may be
/// read ("read"). Returns its name; empty for servers that do not know this command, and allow a
/// dry run in the share's own module; nothing when the server has no copy.
std::optional<std::string> OpenForReading(ServerSession& session, const std::string& share,
                                          const char* access);

/// Lists all of a copy. One that cannot be listed shows nothing.
void ListCopy(ServerSession& session, const std::string& share,
              const std::function<void(const TARQ::Backup::RunChange&)>& on_file);

/// See TaskRun::List(), for one share.
void ListShare(ServerSession& session, const RunOrder& order, const ShareOrder& share,
               const ChangeHandler& on_change,
               const std::function<void(const std::string&)>& on_missing);

}  // namespace programs

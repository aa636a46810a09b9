// Running and watching tasks.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// Requests runs of the tasks from the daemon. `wait`: shows their progress until all have ended,
/// and throws the worst failure. An interrupt ends the waiting, but not the runs.
void RunTasks(const std::vector<std::string>& names, bool wait);

/// Lists what runs of the tasks would send and delete. The daemon finds that out, so the user needs
/// no password.
void ListTaskChanges(const std::vector<std::string>& names);

/// Has files of a task read at both ends: of `share`, if that is named, and of these paths of it,
/// if there are any. Lists what differs, and throws Failure when anything does.
void VerifyTask(const std::string& name, const std::string& share,
                const std::vector<std::string>& paths);

/// Shows what a task, or all if `name` is empty, is doing, until the user interrupts.
void WatchTasks(const std::string& name);

}  // namespace zelctl

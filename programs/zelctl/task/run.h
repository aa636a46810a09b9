// Running tasks, and looking on.
#pragma once

#include <string>
#include <vector>

#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

/// Asks the daemon to run the tasks; `wait`: stays until each of these runs has ended, showing how
/// far it is, and gives the code of the worst. An interrupt ends the looking on alone.
ExitCode RunTasks(const std::vector<std::string>& names, bool wait);

/// Lists what runs of the tasks would send and delete, without the daemon doing anything.
ExitCode ListTaskChanges(const std::vector<std::string>& names);

/// Shows what a task, or all when the name is empty, is doing until the user has seen enough.
ExitCode WatchTasks(const std::string& name);

}  // namespace zelctl

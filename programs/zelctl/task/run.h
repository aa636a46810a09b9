// Running tasks, and looking on.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// Asks the daemon to run the tasks; `wait`: stays until each of these runs has ended, showing how
/// far it is, and fails as the worst of them. An interrupt ends the looking on alone.
void RunTasks(const std::vector<std::string>& names, bool wait);

/// Lists what runs of the tasks would send and delete, without the daemon doing anything.
void ListTaskChanges(const std::vector<std::string>& names);

/// Shows what a task, or all when the name is empty, is doing until the user has seen enough.
void WatchTasks(const std::string& name);

}  // namespace zelctl

// The list of tasks, which people ask for often. It stands on the connection to the daemon alone:
// what the other commands stand on takes longer to load than a thousand tasks take to print.
#pragma once

namespace zelctl {

/// Prints the tasks as a table.
void ListTasks();

}  // namespace zelctl

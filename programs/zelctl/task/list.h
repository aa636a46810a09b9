// The list of tasks. As people often ask for it, it depends on nothing but the connection to the
// daemon: loading what the other commands need takes longer than printing a thousand tasks.
#pragma once

namespace zelctl {

/// Prints the tasks as a table.
void ListTasks();

}  // namespace zelctl

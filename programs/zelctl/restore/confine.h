// A restore writes what a server sends, as root often: it is kept to its folder.
#pragma once

#include <string>

namespace zelctl {

/// From now on this process and those that it starts make, change and remove files below `folder`
/// alone, and what a run needs besides: its scratch files and rsync's log. The kernel sees to that
/// (Landlock), whatever a name or a symbolic link leads to. Owners, modes and times are not
/// covered, nor is truncate(2), which rsync does not call: it cuts files that it has opened for
/// writing, which is covered. Where the kernel has no such thing, all stays as it is.
void WriteOnlyBelow(const std::string& folder);

}  // namespace zelctl

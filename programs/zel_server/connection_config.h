// What the rsync daemon of one connection is configured with: rsyncd.conf, and the modules that are
// open when it starts.
//
// It has a file of its own, since a daemon that included the folder of the modules would serve
// nobody when one of them was closed between its look at the folder and that at the module.
#pragma once

#include <sys/types.h>

#include <string>

namespace zel_server {

/// Writes the file of the calling process, which becomes the daemon: its path, or "" with errno set
/// on failure.
std::string WriteConnectionConfig();

/// Removes it when that process has ended.
void RemoveConnectionConfig(pid_t process);

}  // namespace zel_server

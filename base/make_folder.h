#pragma once

#include <sys/types.h>

#include <string>

namespace base {

/// Makes the folder `path` with exactly this mode, whatever the umask, unless it is there already;
/// those above it that are missing can be entered by everybody. False, with errno set, when it
/// cannot.
bool MakeFolder(const std::string& path, mode_t mode);

}  // namespace base

// Trees of files that clients have made: folders are held open and no link is followed, and a path
// may be longer than the kernel takes at once.
#pragma once

#include <string>

#include "base/unique_fd.h"

namespace zel_server {

/// The folder `name` of the open folder `above` (AT_FDCWD: a path), for reading. Not open, with
/// errno set, when there is none; ELOOP or ENOTDIR for anything else of that name.
base::UniqueFd OpenFolder(int above, const std::string& name);
/// The same, and makes it when nothing is there: for the owner of the folder above, whose time
/// stays as it was.
base::UniqueFd HaveFolder(int above, const std::string& name);

/// "folder/name", or the name alone for the top, whose path is empty.
std::string Below(const std::string& folder, const std::string& name);
/// The other way: what is above the last name of a path, empty for a name alone, and that name.
std::string PathAbove(const std::string& path);
std::string LastName(const std::string& path);
/// Whether `path` is `above` or below it; everything is below the top.
bool IsAtOrBelow(const std::string& path, const std::string& above);

/// Gives the open folder `to` the attributes of `from` in which whose owner, modes and lists are
/// kept. False, with errno set, when it cannot.
bool CopyUserAttributes(int from, int to);

/// Removes what is at `name` with all that is below it; it may be gone. False, with errno set, when
/// something is left. Takes a descriptor for each level: see AllowManyFiles().
bool RemoveTree(int above, const std::string& name);

/// Lets this process have as many files open as it may.
void AllowManyFiles();

}  // namespace zel_server

#pragma once

#include <sys/stat.h>

#include <string>
#include <string_view>
#include <vector>

namespace base {

/// Puts a file of the given content at `path` in one step: after a crash at any instant the old
/// file or the new one is there, whole. A symbolic link is replaced, not followed; anything else
/// but a regular file is left alone. `old` is the file's status, none when there is none: the new
/// file takes its mode and owner.
///
/// The folder holds a file `.<name>.tmp<digit>` meanwhile; what a killed writer left behind is
/// removed by the next one.
///
/// False on failure, with errno set. The old file is then untouched, unless the folder could not be
/// flushed after the rename: the new file is in place, but may not outlive a power cut. Throws
/// std::bad_alloc.
///
/// Writers of one file should not run at the same time (one would undo the other's change), but
/// when they do, none harms the other's file.
bool ReplaceFile(const std::string& path, const std::vector<std::string_view>& content,
                 const struct stat* old);

/// The same for a file of this mode that is the caller's own.
bool ReplaceFile(const std::string& path, std::string_view content, mode_t mode);

}  // namespace base

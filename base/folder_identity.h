// What a folder is known by when its path leads to it again: after a restart, on another day.
#pragma once

#include <optional>
#include <string>

namespace base {

/// Facts about a folder, as texts. One that is not known, or that the next restart could change, is
/// empty: the numbers of devices, and on some file systems of files, are given out anew each time.
struct FolderIdentity {
    std::string file_system;     ///< its kind, as the kernel numbers them; always known
    std::string file_system_id;  ///< statfs(2)
    std::string inode;
    std::string birth;  ///< when the folder was made: seconds and nanoseconds
};

/// The identity of an open folder (O_PATH will do). Nothing, with errno set, when it cannot be
/// examined.
std::optional<FolderIdentity> IdentityOf(int folder);

/// Whether `now` can be the folder that was recorded: what is known of both agrees.
bool IsSameIdentity(const FolderIdentity& recorded, const FolderIdentity& now);

}  // namespace base

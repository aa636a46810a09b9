// What tells whether an entry of a share has changed.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <optional>

namespace zel_daemon {

/// As the file system has it. The time of the last change of the entry itself (ctime) can be set by
/// nobody and follows each write, each change of owner, mode or attributes, and each rename.
struct EntryFacts {
    uint32_t mode = 0;  ///< type and permissions
    uint64_t inode = 0;
    uint64_t size = 0;
    uint64_t modified = 0;  ///< nanoseconds since the epoch, any moment modulo 2^64
    uint64_t changed = 0;   ///< the same
    bool linked = false;    ///< the file has other names
    /// It was changed so shortly before it was looked at that another change could have left the
    /// same times: it is taken for changed.
    bool young = false;

    bool IsFolder() const { return S_ISDIR(mode); }
};

/// Whether what was known is still so, beyond doubt.
bool IsUnchanged(const EntryFacts& known, const EntryFacts& now);

/// When entries were looked at: taken before the first of them.
struct LookTime {
    LookTime();
    int64_t seconds;
    int64_t nanoseconds;
};

/// The facts of the entry `name` in the open folder, of a link its own; "": of the folder itself.
/// Nothing, with errno, when they cannot be had.
std::optional<EntryFacts> FactsOf(int folder, const char* name, const LookTime& look);

}  // namespace zel_daemon

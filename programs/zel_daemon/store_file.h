// The store's file: made whole or not at all, and never made anew where there was one.
#pragma once

#include <string>

#include "programs/common/failure.h"

namespace zel_daemon {

inline constexpr char kBeginAnew[] =
    "stop the daemon and put back a copy, or begin with an empty store by 'zel_daemon "
    "--new-store', which moves away what is there";

/// There was a store, and what is there now is none: `how` says how that is known.
inline programs::Failure LostStore(const std::string& how) {
    return {programs::FailureKind::kLocal, how + "; " + kBeginAnew};
}

/// Sees that the file at `path` can be opened: for the daemon alone (0600, its folder 0700), since
/// tasks have passwords. The first time it is made, with all tables; whenever that is cut off, it
/// begins anew.
///
/// Throws LostStore() where there was a store: the file is empty; or it is gone, and its mark
/// (`path`.made) or its log of changes tells that it was there. Throws std::system_error and
/// SqliteError.
void PrepareStoreFile(const std::string& path);

/// Leaves the mark that there is a store now. Throws std::system_error.
void MarkStoreFile(const std::string& path);

/// Moves the store away, whatever is there of it, so that a new one can be made: the name that it
/// has now, empty when nothing was there. REQUIRES that nobody uses it. Throws std::system_error.
std::string PutStoreAside(const std::string& path);

}  // namespace zel_daemon

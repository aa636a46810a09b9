#pragma once

#include <string>

#include "base/unique_fd.h"

namespace base {

/// Opens the entry at `path`, relative to the open folder `folder`, with the open(2) `flags`
/// (O_CLOEXEC and O_NOFOLLOW are added; nothing is created). No symbolic link on the way, the last
/// name included, is followed and nothing outside of `folder` is ever reached, whatever is renamed
/// meanwhile. "" and "." are the folder itself.
///
/// Works, and is as safe, where the kernel or a filter refuses openat2(2).
///
/// An empty owner with errno when it cannot be opened; ELOOP or ENOTDIR for a link on the way,
/// EXDEV for a `path` that begins with "/" or has a "..".
UniqueFd OpenBeneath(int folder, const std::string& path, int flags);

}  // namespace base

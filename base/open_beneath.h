#pragma once

#include <string>

#include "base/unique_fd.h"

namespace base {

/// Opens the entry at `path`, relative to the open folder `folder`, with the open(2) `flags`
/// (O_CLOEXEC and O_NOFOLLOW are added). No symbolic link on the way, the last name included, is
/// followed and nothing outside of `folder` is ever reached. "" and "." are the folder itself.
///
/// An empty owner with errno when it cannot be opened; ELOOP or ENOTDIR for a link on the way.
UniqueFd OpenBeneath(int folder, const std::string& path, int flags);

}  // namespace base

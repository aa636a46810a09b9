// Tasks that push what a restore writes to.
#pragma once

#include <string>

namespace zelctl {

/// Pauses each task of the daemon's with a share whose folder is `folder`, lies in it or holds it,
/// and ends its run: what comes back, half of it at first, would be pushed at once. Says so. Throws
/// Failure when such a task cannot be paused.
void PauseTasksPushing(const std::string& folder);

}  // namespace zelctl

// Orderly end of a run on Ctrl-C, SIGTERM or SIGHUP.
#pragma once

#include <atomic>

namespace zelctl {

/// From now on SIGINT, SIGTERM and SIGHUP only set a flag instead of ending the program. A second
/// signal ends it.
void WatchForInterrupt();
/// From now on these signals end the program at once again.
void StopWatchingForInterrupt();

/// Whether one of these signals has arrived.
const std::atomic<bool>& Interrupted();

/// Nonzero once one has arrived: an abort flag for channels.
int* InterruptFlag();

}  // namespace zelctl

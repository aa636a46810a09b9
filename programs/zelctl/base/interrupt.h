// Ctrl-C and a polite kill end a run in an orderly way.
#pragma once

#include <atomic>

namespace zelctl {

/// From now on SIGINT, SIGTERM and SIGHUP are noted instead of ending the program. A second one
/// ends it.
void WatchForInterrupt();

/// Whether one has come.
const std::atomic<bool>& Interrupted();

/// Not 0 once one has come: an abort flag for channels.
int* InterruptFlag();

}  // namespace zelctl

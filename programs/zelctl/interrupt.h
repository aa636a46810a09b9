// Ctrl-C and a polite kill end a run in an orderly way.
#pragma once

namespace zelctl {

/// From now on SIGINT, SIGTERM and SIGHUP are noted instead of ending the program. A second one
/// ends it.
void WatchForInterrupt();

/// Whether one has come: a cancel checker for the library's runs.
bool Interrupted();

/// Not 0 once one has come: an abort flag for channels.
int* InterruptFlag();

}  // namespace zelctl

#pragma once

#include <sys/types.h>

#include <optional>

namespace tarq_internal {

/// What the kernel tells of a process.
struct ProcStat {
    char state = '?';  ///< 'Z' for one that has ended and waits for its parent
    pid_t parent = 0;
};

/// Nothing when there is no such process.
std::optional<ProcStat> ReadProcStat(pid_t pid);

}  // namespace tarq_internal

#pragma once

#include <sys/types.h>

namespace base {

/// The process, and what it starts from now on, gives way to all others: it reads and writes when
/// nobody else does, and computes when little else wants to. Where that is refused it goes on as it
/// is.
void GiveWay(pid_t process);

}  // namespace base

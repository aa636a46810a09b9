#include "base/background_priority.h"

#include <sys/resource.h>
#include <sys/syscall.h>
#include <unistd.h>

namespace base {

namespace {

// Of the kernel's interface, which the C library has no names for.
constexpr int kIoPriorityOfProcess = 1;
constexpr int kIdle = 3 << 13;
constexpr int kNice = 19;

}  // namespace

void GiveWay(pid_t process) {
    syscall(SYS_ioprio_set, kIoPriorityOfProcess, process, kIdle);
    setpriority(PRIO_PROCESS, static_cast<id_t>(process), kNice);
}

}  // namespace base

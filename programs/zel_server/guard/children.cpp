// What a transfer has written counts for the process of its connection (BytesWrittenBy() asks the
// kernel), with the children that it has waited for, and theirs. In a transfer that fails rsync may
// leave one of them behind without waiting, the one that writes the files. So it is waited for
// here, after the one that rsync waits for at the end.
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <sys/types.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>

namespace {

// For a child that still ends: nobody waits for more than its end.
constexpr int kTries = 100;
constexpr timespec kPause = {0, 10'000'000};

pid_t connection = 0;

pid_t Wait(pid_t child, int* status, int options) {
    return static_cast<pid_t>(syscall(SYS_wait4, child, status, options, nullptr));
}

// What a child leaves behind becomes this process' own.
__attribute__((constructor)) void Begin() {
    if (prctl(PR_SET_CHILD_SUBREAPER, 1) == 0) {
        connection = getpid();
    }
}

}  // namespace

extern "C" __attribute__((visibility("default"))) pid_t waitpid(pid_t child, int* status,
                                                                int options) noexcept(false) {
    const pid_t ended = Wait(child, status, options);
    if (ended <= 0 || getpid() != connection) {
        return ended;
    }
    const int error = errno;
    for (int i = 0; i < kTries; ++i) {
        const pid_t left = Wait(-1, nullptr, WNOHANG);
        if (left < 0) {
            break;
        }
        if (left == 0) {
            nanosleep(&kPause, nullptr);
        }
    }
    errno = error;
    return ended;
}

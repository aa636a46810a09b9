#include "programs/zel_daemon/shortage.h"

#include <cerrno>
#include <cstring>

namespace zel_daemon {

std::string ReasonOf(int error) {
    switch (error) {
        case EMFILE:
            return "the daemon has as many files open as it may (raise LimitNOFILE= of its unit)";
        case ENFILE:
            return "the system has as many files open as it may (raise the sysctl fs.file-max)";
        case EAGAIN:
            return "no more threads and processes may be started (raise TasksMax= of the daemon's "
                   "unit, or the sysctl kernel.threads-max)";
        case ENOMEM:
            return "memory is short";
        default:
            return strerror(error);
    }
}

}  // namespace zel_daemon

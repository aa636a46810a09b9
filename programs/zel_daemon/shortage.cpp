#include "programs/zel_daemon/shortage.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>
#include <vector>

#include "base/unique_fd.h"
#include "programs/common/host.h"
#include "programs/common/text.h"

namespace zel_daemon {

namespace {

// That a look-up of a share needs.
constexpr unsigned int kLookUpDescriptors = 4;

}  // namespace

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

int LackOfDescriptors(unsigned int count) {
    std::vector<base::UniqueFd> held(count);
    for (base::UniqueFd& fd : held) {
        fd = base::UniqueFd(open("/", O_PATH | O_CLOEXEC));
        if (!fd) {
            return errno;
        }
    }
    return 0;
}

std::string ShareProblem(const std::string& share) {
    if (const int error = LackOfDescriptors(kLookUpDescriptors)) {
        return "share '" + programs::Printable(share) + "' cannot be looked up: " + ReasonOf(error);
    }
    return programs::ShareProblem(share);
}

}  // namespace zel_daemon

#include "programs/zel_daemon/shortage.h"

#include <cerrno>
#include <cstring>

#include "programs/common/host.h"
#include "programs/common/text.h"

namespace zel_daemon {

namespace {

using programs::LackOfDescriptors;

// What a run needs: the ends of pipes to two rsyncs, and files that are read on the way.
constexpr unsigned int kRunDescriptors = 16;

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

std::string RunProblem() {
    const int lack = LackOfDescriptors(kRunDescriptors);
    // What lies in /tmp may have been cleaned away since the start.
    return lack != 0 ? ReasonOf(lack) : programs::PrepareHost();
}

std::string ShareProblem(const std::string& share) {
    int lack = LackOfDescriptors(programs::kLookUpDescriptors);
    const std::string problem = lack == 0 ? programs::ShareProblem(share) : "";
    // Others may have taken them meanwhile.
    lack = problem.empty() ? lack : LackOfDescriptors(programs::kLookUpDescriptors);
    return lack != 0
               ? "share '" + programs::Printable(share) + "' cannot be looked up: " + ReasonOf(lack)
               : problem;
}

}  // namespace zel_daemon

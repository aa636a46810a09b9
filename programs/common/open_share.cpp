#include "programs/common/open_share.h"

#include <fcntl.h>
#include <sys/stat.h>

#include "programs/common/host.h"
#include "programs/common/run_result.h"
#include "programs/common/text.h"

namespace programs {

namespace {

bool LeadsTo(const std::string& path, const struct stat& folder) {
    struct stat info = {};
    return stat(path.c_str(), &info) == 0 && info.st_dev == folder.st_dev &&
           info.st_ino == folder.st_ino;
}

}  // namespace

void CheckShare(const std::string& share) {
    const std::string problem = ShareProblem(share);
    if (!problem.empty()) {
        throw RunFailure(FailureKind::kLocal, 0, problem, Reach::kShare);
    }
}

OpenShare::OpenShare(const std::string& share, const std::string& path)
    : folder_(open(path.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC)),
      path_("/proc/self/fd/" + std::to_string(folder_.Get())) {
    struct stat folder = {};
    const bool before = folder_ && fstat(folder_.Get(), &folder) == 0 && LeadsTo(path, folder);
    CheckShare(share);  // which looks at what the path leads to
    if (!before || !LeadsTo(path, folder)) {
        throw RunFailure(FailureKind::kLocal, 0,
                         "share '" + Printable(share) + "': its folder is being replaced",
                         Reach::kShare);
    }
}

}  // namespace programs

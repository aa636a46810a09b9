#include "programs/zelctl/base/prepare.h"

#include "programs/common/task_run.h"

namespace zelctl {

ExitCode PrepareHost() {
    const std::string problem = programs::PrepareHost();
    return problem.empty() ? kOk : Fail(kLocal, "%s", problem.c_str());
}

}  // namespace zelctl

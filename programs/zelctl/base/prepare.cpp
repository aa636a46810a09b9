#include "programs/zelctl/base/prepare.h"

#include "programs/common/failure.h"
#include "programs/common/host.h"

namespace zelctl {

void PrepareHost() {
    const std::string problem = programs::PrepareHost();
    if (!problem.empty()) {
        throw programs::Failure(programs::FailureKind::kLocal, problem);
    }
}

}  // namespace zelctl

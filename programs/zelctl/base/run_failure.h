#pragma once

#include "programs/common/failure.h"
#include "programs/common/task_run.h"

namespace zelctl {

/// What a run's end comes to.
programs::FailureKind KindOf(programs::Trouble trouble);

}  // namespace zelctl

#include "programs/zelctl/base/run_failure.h"

namespace zelctl {

programs::FailureKind KindOf(programs::Trouble trouble) {
    switch (trouble) {
        case programs::Trouble::kLocal:
            return programs::FailureKind::kLocal;
        case programs::Trouble::kRefused:
            return programs::FailureKind::kRefused;
        case programs::Trouble::kCancelled:
            return programs::FailureKind::kCancelled;
        default:
            return programs::FailureKind::kFailed;
    }
}

}  // namespace zelctl

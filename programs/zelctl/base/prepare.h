#pragma once

#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

/// Makes the folders that the library expects of its host and no package may have made: for the
/// configuration, and for scratch files, which must be nobody else's to change.
ExitCode PrepareHost();

}  // namespace zelctl

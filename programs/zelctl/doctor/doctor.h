// Looks at all that a push needs, and says how to mend what is wrong.
#pragma once

#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

/// Prints what it finds; kLocal when anything fails.
ExitCode Doctor(bool as_json);

}  // namespace zelctl

#pragma once

#include "programs/zelctl/exit_codes.h"

namespace zelctl {

/// Becomes zel_server, which keeps the copies on this machine, with these arguments (a null pointer
/// ends them). Returns only when it is not to be had.
ExitCode BecomeServer(char** arguments);

}  // namespace zelctl

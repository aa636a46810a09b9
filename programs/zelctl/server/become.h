#pragma once

#include <string>
#include <vector>

#include "programs/zelctl/base/exit_codes.h"

namespace zelctl {

/// Becomes zel_server, which keeps the copies on this machine, with these arguments. Returns only
/// when it is not to be had.
ExitCode BecomeServer(const std::vector<std::string>& arguments);

}  // namespace zelctl

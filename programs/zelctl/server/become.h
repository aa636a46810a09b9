#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// Becomes zel_server, which keeps the copies on this machine, with these arguments. Throws
/// Failure when it is not to be had.
[[noreturn]] void BecomeServer(const std::vector<std::string>& arguments);

}  // namespace zelctl

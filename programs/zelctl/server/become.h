#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// Replaces this process by zel_server, the program for the server side, with these arguments.
/// Throws Failure when it is not installed.
[[noreturn]] void BecomeServer(const std::vector<std::string>& arguments);

}  // namespace zelctl

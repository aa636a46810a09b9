#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// What another program has written and returned.
struct ChildOutput {
    std::string failure;  ///< why it gave no usable result, for a person; empty when it did
    int exit_code = -1;
    std::string output;
    std::string errors;  ///< what it wrote to standard error
};

/// Runs a program from PATH to its end, without a shell and with empty standard input. It is ended
/// when it takes longer than half a minute or writes more than 16 MiB.
ChildOutput RunAndRead(const std::vector<std::string>& command);

/// The path of `name` along PATH, or `name` itself when it contains a slash; empty when not found.
std::string FindInPath(const std::string& name);

}  // namespace zelctl

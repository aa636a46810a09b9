#pragma once

#include <string>
#include <vector>

namespace zelctl {

/// What another program has answered.
struct ChildOutput {
    std::string failure;  ///< why there is no answer, for a person; empty when there is one
    int exit_code = -1;
    std::string output;
    std::string errors;  ///< of its standard error
};

/// Runs a program, found along PATH, to its end, without a shell and with nothing to read. One that
/// takes longer than half a minute or writes more than 16 MiB is ended.
ChildOutput RunAndRead(const std::vector<std::string>& command);

/// Where `name` is found along PATH, or itself when it holds a slash; empty when it is not there.
std::string FindInPath(const std::string& name);

}  // namespace zelctl

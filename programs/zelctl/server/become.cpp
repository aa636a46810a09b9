#include "programs/zelctl/server/become.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "base/child_process.h"
#include "programs/common/failure.h"

namespace zelctl {

void BecomeServer(const std::vector<std::string>& arguments) {
    std::vector<std::string> command = {"zel_server"};
    command.insert(command.end(), arguments.begin(), arguments.end());
    const std::vector<char*> words = base::ArgumentVector(command);
    // Prefers the zel_server installed beside this program over one in PATH.
    std::error_code error;
    const std::filesystem::path own = std::filesystem::read_symlink("/proc/self/exe", error);
    execv((own.parent_path() / command[0]).c_str(), words.data());
    execvp(command[0].c_str(), words.data());
    throw programs::Failure(programs::FailureKind::kLocal,
                            std::string("zel_server cannot be started: ") + strerror(errno) +
                                "; is the package zel-server installed?");
}

}  // namespace zelctl

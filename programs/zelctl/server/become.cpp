#include "programs/zelctl/server/become.h"

#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

namespace zelctl {

ExitCode BecomeServer(const std::vector<std::string>& arguments) {
    std::string program = "zel_server";
    std::vector<char*> words = {program.data()};
    for (const std::string& argument : arguments) {
        words.push_back(const_cast<char*>(argument.c_str()));
    }
    words.push_back(nullptr);
    // The one that was installed with this program, or else any.
    std::error_code error;
    const std::filesystem::path own = std::filesystem::read_symlink("/proc/self/exe", error);
    execv((own.parent_path() / program).c_str(), words.data());
    execvp(program.c_str(), words.data());
    return Fail(kLocal, "zel_server cannot be started: %s; is the package zel-server installed?",
                strerror(errno));
}

}  // namespace zelctl

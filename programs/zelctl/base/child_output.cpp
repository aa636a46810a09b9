#include "programs/zelctl/base/child_output.h"

#include <sys/wait.h>

#include <chrono>
#include <cstdlib>
#include <cstring>

#include "base/child_process.h"

namespace zelctl {

namespace {

constexpr std::chrono::seconds kLongest(30);
constexpr size_t kMaxOutput = size_t{16} << 20;
constexpr char kUsualPath[] = "/usr/local/sbin:/usr/local/bin:/usr/sbin:/usr/bin:/sbin:/bin";

std::string SearchPath() {
    const char* const path = getenv("PATH");
    return path != nullptr ? path : kUsualPath;
}

}  // namespace

std::string FindInPath(const std::string& name) {
    return base::FindProgram(name, SearchPath());
}

ChildOutput RunAndRead(const std::vector<std::string>& command) {
    ChildOutput answer;
    base::ChildSetup setup;
    setup.program = FindInPath(command[0]);
    if (setup.program.empty()) {
        answer.failure = command[0] + " is not installed";
        return answer;
    }
    setup.arguments = command;
    setup.environment = {"LC_ALL=C", "PATH=" + SearchPath()};
    const auto end = std::chrono::steady_clock::now() + kLongest;
    const auto enough = [&] {
        return std::chrono::steady_clock::now() > end ||
               answer.output.size() + answer.errors.size() > kMaxOutput;
    };
    const base::ChildResult result = base::RunChild(
        setup, enough, [&](const char* bytes, size_t size) { answer.output.append(bytes, size); },
        [&](const char* bytes, size_t size) { answer.errors.append(bytes, size); });
    if (result.start_error != 0) {
        answer.failure = setup.program + " cannot be started: " + strerror(result.start_error);
    } else if (result.cancelled) {
        answer.failure = setup.program + " does not come to an end";
    } else {
        answer.exit_code =
            WIFEXITED(result.wait_status) ? WEXITSTATUS(result.wait_status) : EXIT_FAILURE;
    }
    return answer;
}

}  // namespace zelctl

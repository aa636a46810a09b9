#include "programs/zel_server/connection_config.h"

#include <fcntl.h>
#include <unistd.h>

#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/share_module.h"

namespace zel_server {

namespace {

std::string PathFor(pid_t process) {
    return ConnectionConfigs() + "/" + std::to_string(process);
}

}  // namespace

std::string WriteConnectionConfig() {
    const auto common = base::ReadFile(RsyncdConfig());
    const auto modules = common ? TextOfModules() : std::nullopt;
    const std::string path = PathFor(getpid());
    constexpr int kFlags = O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC;
    const base::UniqueFd file(
        modules && MakeInAnswers(ConnectionConfigs()) ? open(path.c_str(), kFlags, 0600) : -1);
    return file && base::WriteAll(file.Get(), *common + *modules) ? path : "";
}

void RemoveConnectionConfig(pid_t process) {
    unlink(PathFor(process).c_str());
}

}  // namespace zel_server

#include "programs/zel_server/connection_config.h"

#include <fcntl.h>
#include <unistd.h>

#include <filesystem>

#include "base/make_folder.h"
#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "programs/zel_server/server_config.h"
#include "programs/zel_server/share_module.h"

namespace zel_server {

namespace {

std::string Folder() {
    return AnswerFolder() + "/.configs";
}

std::string PathFor(pid_t process) {
    return Folder() + "/" + std::to_string(process);
}

}  // namespace

ConnectionConfig::ConnectionConfig(pid_t process) : path_(PathFor(process)) {}

ConnectionConfig::ConnectionConfig(ConnectionConfig&& other) noexcept {
    path_.swap(other.path_);
}

ConnectionConfig& ConnectionConfig::operator=(ConnectionConfig&& other) noexcept {
    path_.swap(other.path_);
    return *this;
}

ConnectionConfig::~ConnectionConfig() {
    if (!path_.empty()) {
        unlink(path_.c_str());
    }
}

std::string ConnectionConfig::Write() {
    const auto common = base::ReadFile(RsyncdConfig());
    const auto modules = common ? TextOfModules() : std::nullopt;
    const std::string path = PathFor(getpid());
    constexpr int kFlags = O_WRONLY | O_CREAT | O_TRUNC | O_NOFOLLOW | O_CLOEXEC;
    const base::UniqueFd file(modules ? open(path.c_str(), kFlags, 0600) : -1);
    return file && base::WriteAll(file.Get(), *common + *modules) ? path : "";
}

bool ConnectionConfig::MakeFolder() {
    std::error_code error;
    std::filesystem::remove_all(Folder(), error);
    return base::MakeFolder(Folder(), 0700);
}

}  // namespace zel_server

#include "platform/tarqrsync/private_folder.h"

#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <system_error>

#include "base/unique_fd.h"
#include "base/whole_file.h"
#include "tarq/root_path.h"

namespace TARQ {
namespace Backup {

namespace {

std::string TemporaryFolder() {
    const char* const chosen = RootFolder().empty() ? secure_getenv("TMPDIR") : nullptr;
    return chosen != nullptr && chosen[0] == '/' ? chosen : RootPath("/tmp");
}

}  // namespace

PrivateFileError::PrivateFileError(const std::string& what)
    : std::runtime_error(what + ": " + strerror(errno)) {}

PrivateFolder::~PrivateFolder() {
    if (!folder_.empty()) {
        std::error_code ignored;
        std::filesystem::remove_all(folder_, ignored);
    }
}

std::string PrivateFolder::Path(const std::string& name) {
    if (folder_.empty()) {
        const std::string parent = TemporaryFolder();
        mkdir(parent.c_str(), 0700);  // a root folder of somebody's own may lack it
        std::string pattern = parent + "/tarqrsync.XXXXXX";
        if (mkdtemp(pattern.data()) == nullptr) {
            throw PrivateFileError("cannot make a folder in " + parent);
        }
        folder_ = pattern;
    }
    return folder_ + "/" + name;
}

std::string PrivateFolder::Write(const std::string& name, const std::string& content) {
    std::string path = Path(name);
    const base::UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (!fd || !base::WriteAll(fd.Get(), content)) {
        throw PrivateFileError("cannot write " + path);
    }
    return path;
}

}  // namespace Backup
}  // namespace TARQ

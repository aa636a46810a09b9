#include "base/folder_names.h"

#include <dirent.h>
#include <fcntl.h>

#include <cerrno>
#include <memory>

#include "base/unique_fd.h"

namespace base {

namespace {

struct FolderCloser {
    void operator()(DIR* folder) const { closedir(folder); }
};

}  // namespace

std::optional<std::vector<std::string>> NamesIn(int folder) {
    // A descriptor made by dup() would share the caller's position.
    UniqueFd own(openat(folder, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const std::unique_ptr<DIR, FolderCloser> open(own ? fdopendir(own.Get()) : nullptr);
    if (!open) {
        return std::nullopt;
    }
    own.Release();
    std::vector<std::string> names;
    errno = 0;
    while (const dirent* const entry = readdir(open.get())) {
        std::string name = entry->d_name;
        if (name != "." && name != "..") {
            names.push_back(std::move(name));
        }
        errno = 0;
    }
    return errno == 0 ? std::optional(std::move(names)) : std::nullopt;
}

}  // namespace base

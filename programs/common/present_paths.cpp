#include "programs/common/present_paths.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <utility>

#include "base/open_beneath.h"
#include "base/unique_fd.h"

namespace programs {

namespace {

bool IsBelow(const std::string& path, const std::string& folder) {
    return folder == "/" || (path.size() > folder.size() && path[folder.size()] == '/' &&
                             path.compare(0, folder.size(), folder) == 0);
}

// Whether `path` can be sent by itself: a file or folder below the share's folder (open as
// `folder`) that no link on the way leads to, so that nothing outside the share is ever sent. A
// link is sent with the folder that it is in.
bool IsPresent(int folder, const std::string& path) {
    const base::UniqueFd entry =
        base::OpenBeneath(folder, path.substr(path.find_first_not_of('/')), O_PATH);
    struct stat info = {};
    return entry && fstat(entry.Get(), &info) == 0 && !S_ISLNK(info.st_mode);
}

}  // namespace

std::vector<PresentPath> PresentPaths(const std::string& folder,
                                      const std::vector<std::string>& ordered) {
    const base::UniqueFd root(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::vector<PresentPath> present;
    for (const std::string& wanted : ordered) {
        std::string path = wanted;
        while (path.find_first_not_of('/') != std::string::npos && !IsPresent(root.Get(), path)) {
            path.resize(std::max<size_t>(path.rfind('/'), 1));
        }
        present.push_back({path, {wanted}});
    }
    std::sort(present.begin(), present.end(),
              [](const auto& one, const auto& other) { return one.path < other.path; });
    std::vector<PresentPath> fewest;
    for (PresentPath& item : present) {
        const auto above = std::find_if(fewest.begin(), fewest.end(), [&](const auto& kept) {
            return item.path == kept.path || IsBelow(item.path, kept.path);
        });
        if (above == fewest.end()) {
            fewest.push_back(std::move(item));
        } else {
            above->ordered.push_back(std::move(item.ordered.front()));
        }
    }
    return fewest;
}

}  // namespace programs

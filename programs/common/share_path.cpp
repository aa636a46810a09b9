#include "programs/common/share_path.h"

#include <algorithm>
#include <iterator>

#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

std::optional<std::string> PathInShare(const std::string& written) {
    if (written.find('\0') != std::string::npos) {
        return std::nullopt;
    }
    std::string path;
    for (size_t begin = 0; begin < written.size();) {
        const size_t end = std::min(written.find('/', begin), written.size());
        const std::string name = written.substr(begin, end - begin);
        begin = end + 1;
        if (name == "..") {
            return std::nullopt;
        }
        if (!name.empty() && name != ".") {
            path += (path.empty() ? "" : "/") + name;
        }
    }
    return path;
}

bool IsReservedInShare(const std::string& path) {
    const size_t begin = path.compare(0, 1, "/") == 0 ? 1 : 0;
    const std::string top = path.substr(begin, path.find('/', begin) - begin);
    const auto& names = TARQ::Backup::kReservedNames;
    return std::find(std::begin(names), std::end(names), top) != std::end(names);
}

bool IsMovableInShare(const std::string& path) {
    const std::string partials = std::string("/") + TARQ::Backup::kResumedFolder + "/";
    return !path.empty() && PathInShare(path) == path && !IsReservedInShare(path) &&
           ("/" + path + "/").find(partials) == std::string::npos;
}

std::string FolderAbove(const std::string& path) {
    return path.substr(0, std::max<size_t>(path.rfind('/'), 1));
}

std::string RequirePathInShare(const std::string& written) {
    auto path = PathInShare(written);
    if (!path) {
        throw Failure(FailureKind::kUsage, "the path " + Printable(written) +
                                               " has a '..': name a path below the share");
    }
    return *std::move(path);
}

}  // namespace programs

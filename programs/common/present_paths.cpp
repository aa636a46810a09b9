#include "programs/common/present_paths.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "base/open_beneath.h"
#include "base/unique_fd.h"
#include "programs/common/mounts_below.h"
#include "programs/common/share_path.h"

namespace programs {

namespace {

using Kind = PresentPath::Kind;

constexpr char kTop[] = "/";

/// What stands at a path.
enum class Found {
    kFolder,
    kOther,  // a file or a link, with nothing below it
    kNothing,
    kUnknown  // it cannot be looked at, or only through something that is no folder
};

Found LookAt(int top, const std::string& path) {
    const size_t begin = path.find_first_not_of('/');
    const base::UniqueFd entry =
        base::OpenBeneath(top, begin == std::string::npos ? "" : path.substr(begin), O_PATH);
    struct stat info = {};
    if (!entry) {
        return errno == ENOENT ? Found::kNothing : Found::kUnknown;
    }
    return fstat(entry.Get(), &info) != 0 ? Found::kUnknown
           : S_ISDIR(info.st_mode)        ? Found::kFolder
                                          : Found::kOther;
}

// Goes up from `wanted` to what is there.
PresentPath Resolved(int top, const std::string& wanted, Deletions deletions) {
    std::string path = wanted;
    std::string below;  // where it has come from
    Found below_it = Found::kUnknown;
    Found found = LookAt(top, path);
    while (path.size() > 1 && (found == Found::kNothing || found == Found::kUnknown)) {
        below_it = found;
        below = std::exchange(path, FolderAbove(path));
        found = LookAt(top, path);
    }
    if (below.empty() || found == Found::kOther || below_it == Found::kUnknown ||
        deletions == Deletions::kByTree) {
        return {path, {wanted}, Kind::kWhole, found != Found::kOther};
    }
    return deletions == Deletions::kNamed ? PresentPath{below, {wanted}, Kind::kGone}
                                          : PresentPath{path, {wanted}, Kind::kEntries, true};
}

// Folders come right before all that is below them; of one path, what covers more comes first.
bool ComesBefore(const PresentPath& one, const PresentPath& other) {
    const auto rank = [](char c) { return c == '/' ? 0 : static_cast<unsigned char>(c) + 1; };
    const auto [mine, its] =
        std::mismatch(one.path.begin(), one.path.end(), other.path.begin(), other.path.end());
    if (mine == one.path.end() || its == other.path.end()) {
        return one.path.size() != other.path.size() ? one.path.size() < other.path.size()
                                                    : one.kind < other.kind;
    }
    return rank(*mine) < rank(*its);
}

bool Covers(const PresentPath& above, const PresentPath& path) {
    return above.kind == Kind::kEntries ? path.kind == Kind::kEntries && path.path == above.path
                                        : IsAtOrBelow(path.path, above.path);
}

}  // namespace

std::vector<PresentPath> PresentPaths(const std::string& folder,
                                      const std::vector<std::string>& ordered,
                                      Deletions deletions) {
    const base::UniqueFd top(open(folder.c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC));
    std::vector<PresentPath> present;
    present.reserve(ordered.size());
    for (const std::string& wanted : ordered) {
        if (!IsReservedInShare(wanted)) {
            present.push_back(wanted == kTop ? PresentPath{wanted, {wanted}, Kind::kWhole, true}
                                             : Resolved(top.Get(), wanted, deletions));
        }
    }
    std::sort(present.begin(), present.end(), ComesBefore);
    std::vector<PresentPath> fewest;
    size_t covering = 0;  // the last that may cover more than itself
    for (PresentPath& item : present) {
        PresentPath* above = nullptr;
        if (!fewest.empty() && Covers(fewest[covering], item)) {
            above = &fewest[covering];
        } else if (!fewest.empty() && Covers(fewest.back(), item)) {
            above = &fewest.back();
        }
        if (above != nullptr) {
            above->ordered.push_back(std::move(item.ordered.front()));
            continue;
        }
        fewest.push_back(std::move(item));
        if (fewest.back().kind != Kind::kEntries) {
            covering = fewest.size() - 1;
        }
    }
    return fewest;
}

}  // namespace programs

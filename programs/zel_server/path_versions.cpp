#include "programs/zel_server/path_versions.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>

#include <cerrno>
#include <system_error>
#include <vector>

#include "base/folder_names.h"
#include "base/open_beneath.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/file_tree.h"

namespace zel_server {

namespace {

using base::OpenBeneath;
using base::UniqueFd;

constexpr uint64_t kMaxCounted = 1000000;
// Each costs a look at all moves since: whoever moves one thing to and fro keeps nobody busy.
constexpr size_t kMaxMoves = 256;

bool Look(int folder, const char* name, struct statx& facts) {
    const int flags = AT_SYMLINK_NOFOLLOW | (*name == '\0' ? AT_EMPTY_PATH : 0);
    return statx(folder, name, flags, STATX_TYPE | STATX_SIZE | STATX_BTIME, &facts) == 0;
}

// Adds what is below the open folder, as far as it can be read.
void CountBelow(const UniqueFd& top, PathVersion& version) {
    std::vector<std::string> folders = {""};
    while (!folders.empty()) {
        const std::string path = std::move(folders.back());
        folders.pop_back();
        const UniqueFd folder = OpenBeneath(top.Get(), path, O_RDONLY | O_DIRECTORY);
        const auto names = folder ? base::NamesIn(folder.Get()) : std::nullopt;
        for (const std::string& name : names.value_or(std::vector<std::string>())) {
            struct statx facts = {};
            if (!Look(folder.Get(), name.c_str(), facts)) {
                continue;
            }
            if (S_ISDIR(facts.stx_mode)) {
                folders.push_back(Below(path, name));
            } else {
                ++version.files;
                version.bytes += facts.stx_size;
            }
        }
    }
}

// What is at `path` below the open folder; no files when nothing is.
PathVersion VersionIn(const UniqueFd& root, const std::string& path) {
    PathVersion version;
    const UniqueFd entry = root ? OpenBeneath(root.Get(), path, O_PATH) : UniqueFd();
    struct statx facts = {};
    if (!entry || !Look(entry.Get(), "", facts)) {
        return version;
    }
    if (S_ISDIR(facts.stx_mode)) {
        const UniqueFd top = OpenBeneath(root.Get(), path, O_RDONLY | O_DIRECTORY);
        if (top) {
            CountBelow(top, version);
        }
    } else {
        version.files = 1;
        version.bytes = facts.stx_size;
        if ((facts.stx_mask & STATX_BTIME) != 0) {
            version.since = {facts.stx_btime.tv_sec, static_cast<int32_t>(facts.stx_btime.tv_nsec)};
        }
    }
    return version;
}

/// The versions of a path, and what has gone from there by a move: that is where it went, in the
/// copy or the first version since.
class History {
public:
    History(const std::string& copy, const std::string& path,
            const std::vector<VersionFolder>& versions, const std::vector<RecordedMove>& moves)
        : copy_(copy), path_(path), versions_(versions), moves_(moves) {}

    PathVersion Of(const VersionFolder& folder) const {
        PathVersion version = VersionIn(OpenFolder(AT_FDCWD, folder.path), path_);
        version.until = folder.time;
        return version;
    }

    bool Concerns(const RecordedMove& move) const { return IsAtOrBelow(path_, move.from); }
    PathVersion Of(const RecordedMove& move) const {
        const std::string to = move.to + path_.substr(move.from.size());
        NamesOverTime names(moves_, move.time);
        PathVersion version;
        for (const VersionFolder& folder : versions_) {
            const auto now = move.time < folder.time && version.files == 0
                                 ? names.Until(folder.time).Now(to)
                                 : std::nullopt;
            if (now) {
                version = VersionIn(OpenFolder(AT_FDCWD, folder.path), *now);
            }
        }
        const auto now = version.files == 0 ? names.UntilNow().Now(to) : std::nullopt;
        if (now) {
            version = VersionIn(OpenFolder(AT_FDCWD, copy_), *now);
        }
        version.until = move.time;
        return version;
    }

private:
    const std::string& copy_;
    const std::string& path_;
    const std::vector<VersionFolder>& versions_;
    const std::vector<RecordedMove>& moves_;
};

}  // namespace

bool VisitVersions(const std::string& share, const std::string& copy, const std::string& path,
                   const std::function<bool(const PathVersion&)>& visit) {
    const std::string all = VersionsOf(share, copy);
    const VersionsLock lock(all, LOCK_SH);
    const auto folders = ListVersions(all);
    const auto moves = ListMoves(all);
    if (!folders || !moves || (!lock && !folders->empty())) {
        throw std::system_error(errno, std::generic_category(), "cannot list versions");
    }
    const History history(copy, path, *folders, *moves);
    uint64_t counted = 0;
    size_t moved = 0;
    auto move = moves->rbegin();
    for (auto folder = folders->rbegin(); folder != folders->rend() || move != moves->rend();) {
        PathVersion version;
        if (move == moves->rend() || (folder != folders->rend() && move->time < folder->time)) {
            version = history.Of(*folder++);
        } else {
            const RecordedMove& last = *move++;
            if (!history.Concerns(last)) {
                continue;
            }
            if (++moved > kMaxMoves) {
                return false;
            }
            version = history.Of(last);
        }
        counted += version.files;
        if (version.files != 0 && !visit(version)) {
            return false;
        }
        if (counted > kMaxCounted) {
            return false;
        }
    }
    return true;
}

}  // namespace zel_server

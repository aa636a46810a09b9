#include "programs/zel_server/version_keeper.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <map>
#include <vector>

#include "base/folder_names.h"
#include "base/random_digits.h"
#include "base/unique_fd.h"
#include "programs/zel_server/copy_moves.h"
#include "programs/zel_server/file_tree.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/share_module.h"
#include "programs/zel_server/storage.h"
#include "programs/zel_server/version_store.h"

namespace zel_server {

namespace {

bool IsFolder(int above, const std::string& name) {
    struct stat info = {};
    return fstatat(above, name.c_str(), &info, AT_SYMLINK_NOFOLLOW) == 0 && S_ISDIR(info.st_mode);
}

// The share's versions, made when there is something to put into them.
class Store {
public:
    Store(const std::string& share, const std::string& copy) : share_(share), copy_(copy) {}

    // What a connection has left: `name` in the folder `from`.
    bool Take(int from, const std::string& name) {
        return Open() && renameat(from, name.c_str(), folder_.Get(),
                                  VersionName(VersionTime::Now(), name).c_str()) == 0;
    }

    // An entry that is no connection's becomes the version of its own path in the share.
    bool TakeForeign(int from, const std::string& name, bool below_reserved) {
        const std::string id = base::RandomDigits();
        if (id.empty() || !Open()) {
            return false;
        }
        const base::UniqueFd version =
            HaveFolder(folder_.Get(), VersionName(VersionTime::Now(), id).c_str());
        const base::UniqueFd place = !version         ? base::UniqueFd()
                                     : below_reserved ? HaveFolder(version.Get(), kVersionsInCopy)
                                                      : base::UniqueFd(dup(version.Get()));
        return place && renameat(from, name.c_str(), place.Get(), name.c_str()) == 0;
    }

private:
    bool Open() {
        if (!folder_) {
            folder_ = HaveVersions(share_, copy_);
        }
        return static_cast<bool>(folder_);
    }

    const std::string& share_;
    const std::string& copy_;
    base::UniqueFd folder_;
};

}  // namespace

bool TakeVersions(const std::string& share, const std::string& copy) {
    // What an interrupted connection has left has the names that moves have given it.
    if (!SettleMoves(share, copy)) {
        return false;
    }
    const base::UniqueFd top = OpenFolder(AT_FDCWD, copy);
    if (!top) {
        return errno == ENOENT;
    }
    Store store(share, copy);
    const base::UniqueFd left = OpenFolder(top.Get(), kVersionsInCopy);
    if (!left) {
        return errno == ENOENT || ((errno == ENOTDIR || errno == ELOOP) &&
                                   store.TakeForeign(top.Get(), kVersionsInCopy, false));
    }
    const auto names = base::NamesIn(left.Get());
    if (!names) {
        return false;
    }
    const std::map<std::string, pid_t> running =
        names->empty() ? std::map<std::string, pid_t>() : TransfersInto(share);
    bool all = true;
    for (const std::string& name : *names) {
        const bool is_run = IsVersionId(name) && IsFolder(left.Get(), name);
        if (running.count(name) != 0) {
            continue;
        }
        if (!is_run) {
            all = store.TakeForeign(left.Get(), name, true) && all;
        } else if (unlinkat(left.Get(), name.c_str(), AT_REMOVEDIR) != 0) {
            all = store.Take(left.Get(), name) && all;
        }
    }
    return all;
}

bool PrepareVersions(const std::string& share, const std::string& copy, const std::string& id) {
    if (!SettleMoves(share, copy)) {
        return false;
    }
    TakeVersions(share, copy);
    const base::UniqueFd top = OpenFolder(AT_FDCWD, copy);
    const base::UniqueFd reserved = top ? HaveFolder(top.Get(), kVersionsInCopy) : base::UniqueFd();
    struct stat info = {};
    return reserved && TransfersInto(share).count(id) == 0 &&
           fstatat(reserved.Get(), id.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0;
}

}  // namespace zel_server

#include "programs/zel_daemon/tree_list.h"

#include <dirent.h>
#include <fcntl.h>

#include <algorithm>
#include <cerrno>
#include <memory>
#include <string_view>
#include <utility>

#include "base/open_beneath.h"
#include "programs/common/failure.h"
#include "programs/common/share_path.h"
#include "programs/zel_daemon/share_folder.h"
#include "tarq/rsync_wrapper.h"

namespace zel_daemon {

namespace {

using base::UniqueFd;

constexpr size_t kMostNames = 65536;

struct FolderCloser {
    void operator()(DIR* folder) const { closedir(folder); }
};

/// Vanished, or taken by something else, since its folder was read.
bool IsGone(int error) {
    return error == ENOENT || error == ENOTDIR || error == ELOOP || error == EXDEV;
}

std::string Below(const std::string& folder, const std::string& name) {
    return (folder == "/" ? "" : folder) + "/" + name;
}

}  // namespace

TreeList::TreeList(std::string folder, std::string start, std::function<bool()> cancelled)
    : folder_(std::move(folder)), start_(std::move(start)), cancelled_(std::move(cancelled)) {
    fstat(OpenShareFolder(folder_).Get(), &identity_);
}

UniqueFd TreeList::OpenShare() {
    UniqueFd share = OpenShareFolder(folder_);
    struct stat now = {};
    if (fstat(share.Get(), &now) != 0 || now.st_dev != identity_.st_dev ||
        now.st_ino != identity_.st_ino) {
        throw programs::Failure(programs::FailureKind::kLocal,
                                folder_ + " is not the folder any more that it was");
    }
    return share;
}

// Reads the names that come next. 0, or why not all can be read.
int TreeList::ReadNames(int folder, Level& level) const {
    UniqueFd own(openat(folder, ".", O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const std::unique_ptr<DIR, FolderCloser> names(own ? fdopendir(own.Get()) : nullptr);
    if (!names) {
        return errno;
    }
    own.Release();
    const auto by_name = [](const Item& one, const Item& other) { return one.name < other.name; };
    std::vector<Item> items;  // once it is full, a heap with the last name on top
    level.more = false;
    errno = 0;
    while (const dirent64* const entry = cancelled_() ? nullptr : readdir64(names.get())) {
        const std::string_view name = entry->d_name;
        if (name == "." || name == ".." || name == TARQ::Backup::kResumedFolder ||
            name <= level.last ||
            (level.path == "/" && programs::IsReservedInShare(std::string(name)))) {
            continue;
        }
        if (items.size() == kMostNames) {
            if (!std::exchange(level.more, true)) {
                std::make_heap(items.begin(), items.end(), by_name);
            }
            if (name >= items.front().name) {
                continue;
            }
            std::pop_heap(items.begin(), items.end(), by_name);
            items.pop_back();
        }
        items.push_back({std::string(name), static_cast<ino_t>(entry->d_ino), {}});
        if (level.more) {
            std::push_heap(items.begin(), items.end(), by_name);
        }
    }
    const int error = errno;
    const auto last = std::max_element(items.begin(), items.end(), by_name);
    level.last = last == items.end() ? "" : last->name;
    level.items = std::move(items);
    level.at = 0;
    return error;
}

// The same, with what is known of each.
int TreeList::Fill(Level& level) {
    const UniqueFd share = OpenShare();
    const UniqueFd folder =
        base::OpenBeneath(share.Get(), level.path.substr(1), O_RDONLY | O_DIRECTORY | O_NONBLOCK);
    const int unread = folder ? ReadNames(folder.Get(), level) : errno;
    if (unread != 0) {
        return unread;
    }
    // In the order in which most file systems keep them: a disk need not go to and fro.
    std::sort(level.items.begin(), level.items.end(),
              [](const Item& one, const Item& other) { return one.inode < other.inode; });
    const LookTime look;
    size_t kept = 0;
    for (Item& item : level.items) {
        if (const auto facts = FactsOf(folder.Get(), item.name.c_str(), look)) {
            item.facts = *facts;
            std::swap(level.items[kept++], item);
        } else if (!IsGone(errno)) {
            return errno;
        }
    }
    level.items.resize(kept);
    std::sort(level.items.begin(), level.items.end(),
              [](const Item& one, const Item& other) { return one.name < other.name; });
    return 0;
}

TreeList::Found TreeList::Next(Entry& entry) {
    if (!std::exchange(begun_, true)) {
        const auto facts = FactsAt(OpenShare(), start_);
        if (!facts) {
            return Found::kEnd;
        }
        entry = {start_, *facts};
        if (facts->IsFolder()) {
            enter_ = start_;
        }
        return Found::kEntry;
    }
    if (enter_) {
        levels_.push_back({*std::exchange(enter_, std::nullopt), {}});
    }
    while (!levels_.empty() && !cancelled_()) {
        Level& level = levels_.back();
        if (level.at < level.items.size()) {
            Item& item = level.items[level.at++];
            entry = {Below(level.path, item.name), item.facts};
            if (item.facts.IsFolder()) {
                enter_ = entry.path;
            }
            return Found::kEntry;
        }
        const bool at_end = !level.more;
        const int error = at_end ? 0 : Fill(level);
        if (at_end || error != 0) {
            entry.path = level.path;
            levels_.pop_back();
        }
        if (error != 0 && !IsGone(error)) {
            return Found::kUnreadable;
        }
    }
    return Found::kEnd;
}

}  // namespace zel_daemon

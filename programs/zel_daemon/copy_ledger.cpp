#include "programs/zel_daemon/copy_ledger.h"

#include <algorithm>
#include <utility>

namespace zel_daemon {

namespace {

// More folders that went are any number of files.
constexpr size_t kMostFolders = 256;

}  // namespace

void CopyLedger::SetShares(const std::list<std::string>& shares, bool anew) {
    std::map<std::string, Copy> kept;
    for (const std::string& share : shares) {
        if (const auto known = copies_.find(share); !anew && known != copies_.end()) {
            kept[share] = std::move(known->second);
        } else {
            kept[share];
        }
    }
    copies_ = std::move(kept);
}

void CopyLedger::Restore(const Files& files) {
    for (const auto& [share, count] : files) {
        if (const auto copy = copies_.find(share); copy != copies_.end()) {
            copy->second.files = count;
        }
    }
}

void CopyLedger::Changed(const std::string& share, const std::string& path) {
    if (const auto copy = copies_.find(share); copy != copies_.end()) {
        const bool folder = path.size() > 1 && path.back() == '/';
        Changes one;
        if (folder) {
            one.folders.insert(path.substr(0, path.size() - 1));
        } else {
            one.files = 1;
        }
        copy->second.changes.Add(std::move(one));
    }
}

void CopyLedger::ChangedBefore(const std::string& share) {
    if (const auto copy = copies_.find(share); copy != copies_.end()) {
        copy->second.changes.files = kAny;
    }
}

programs::Brake CopyLedger::Take(const programs::ShareOrder& order, unsigned int percent) {
    Copy& copy = copies_[order.share];
    copy.taken = std::exchange(copy.changes, {});
    programs::Brake brake;
    brake.percent = percent;
    brake.files = copy.files;
    brake.recent = copy.recent;
    const bool whole = order.paths.size() == 1 && order.paths.front() == "/";
    if (!whole && copy.taken.files < kAny) {
        brake.at_most = copy.taken.files;
        brake.folders = copy.taken.folders;
    }
    return brake;
}

void CopyLedger::Changes::Add(Changes other) {
    files = std::min(kAny, files + other.files);
    folders.merge(other.folders);
    if (folders.size() > kMostFolders) {
        files = kAny;
        folders.clear();
    }
}

void CopyLedger::PutBack() {
    for (auto& [share, copy] : copies_) {
        copy.PutBack();
    }
}

CopyLedger::Files CopyLedger::Settle(const programs::RunOrder& order,
                                     const programs::RunResult& result, int64_t now) {
    Files changed;
    for (const programs::ShareOrder& share : order.shares) {
        Copy& copy = copies_[share.share];
        const bool failed =
            std::any_of(result.undone.begin(), result.undone.end(),
                        [&](const programs::Undone& item) { return item.share == share.share; });
        if (failed) {
            copy.PutBack();
        }
        copy.taken = {};
        const auto made = result.copies.find(share.share);
        if (made == result.copies.end()) {
            continue;
        }
        programs::CopyChanges changes = made->second;
        if (!copy.files) {
            changes.born.clear();  // all of it is new, and none of it is temporary
        }
        copy.recent->Add(changes, now);
        if (!failed && share.consent) {
            copy.recent->Clear();  // a person has let it go
        }
        std::optional<uint64_t> files = copy.files;
        if (changes.files && !failed) {
            files = changes.files;
        } else if (files) {
            const int64_t count = static_cast<int64_t>(*files) + changes.growth;
            files = static_cast<uint64_t>(std::max<int64_t>(count, 0));
        }
        if (files && files != copy.files) {
            copy.files = files;
            changed[share.share] = *files;
        }
    }
    return changed;
}

}  // namespace zel_daemon

#include "programs/zel_daemon/run_index.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>
#include <iterator>
#include <optional>

#include "ZEL/log.h"
#include "ZEL/zel.h"
#include "base/percent.h"
#include "programs/common/host.h"
#include "programs/common/share_notes.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/known_files.h"
#include "programs/zel_daemon/moved_folder.h"
#include "programs/zel_daemon/path_key.h"
#include "programs/zel_daemon/share_debts.h"
#include "programs/zel_daemon/share_folder.h"
#include "programs/zel_daemon/tree_list.h"

namespace zel_daemon {

namespace {

namespace fs = std::filesystem;
using programs::ShareOrder;
using ZEL::Logger;

// What a run of single paths may note: a million and a half entries.
constexpr size_t kMostBytes = size_t{64} << 20;
// Of the files with other names, so many are looked after in a run.
constexpr size_t kMostLinked = 1000;
// So many files of a run, and so many bytes of them, are compared by their bytes. What is more is
// left to the verification.
constexpr size_t kMostDoubtful = 1000;
constexpr uint64_t kMostDoubtfulBytes = uint64_t{1} << 30;

bool IsWhole(const ShareOrder& order) {
    return std::find(order.paths.begin(), order.paths.end(), programs::kWholeShare) !=
           order.paths.end();
}

std::string FolderOf(const std::string& share) {
    ZEL::ShareInfo facts;
    return ZEL::GetShareInfo(share, facts) == 0 ? facts.GetModulePath() : "";
}

struct LinkedFile {
    struct stat status = {};
    EntryFacts facts;
};

// Names of these files in a share that its copy has otherwise.
void FindOtherNames(const std::string& file, const std::string& share, const std::string& folder,
                    const std::vector<LinkedFile>& files, RunIndexes::Linked& found) {
    try {
        FileIndex index(file);
        IndexLookup lookup(index);
        for (const LinkedFile& sent : files) {
            for (const std::string& key : index.NamesOf(sent.facts.inode)) {
                const std::string path = PathOf(key);
                const EntryFacts* const known = lookup.Find(key);
                struct stat other = {};
                if (found.size() < kMostLinked && known != nullptr &&
                    !IsUnchanged(*known, sent.facts) &&
                    lstat((folder + path).c_str(), &other) == 0 &&
                    other.st_dev == sent.status.st_dev && other.st_ino == sent.status.st_ino) {
                    found.emplace_back(share, path);
                }
            }
        }
    } catch (const std::exception& error) {
        // Whoever needs it next will say so and remove it.
        Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] zel_daemon(%d): %s: %s\n", __LINE__,
                       file.c_str(), error.what());
    }
}

}  // namespace

std::string IndexPlace::FileOf(const std::string& share) const {
    return folder + "/" + base::PercentEncoded(share, "-_") + ".index";
}

IndexPlace PlaceOf(const std::string& folder, uint64_t task_id, const ZEL::SyncInfo& info,
                   const std::vector<std::string>& excludes) {
    IndexPlace place{folder + "/" + std::to_string(task_id), programs::ServerOf(info)};
    place.settings += '\0' + info.GetUser();
    for (const std::string& rule : excludes) {
        place.settings += '\0' + rule;
    }
    return place;
}

// One share's. Where something fails, the index is dropped.
class RunIndexes::Share {
public:
    Share(const IndexPlace& place, ShareOrder& order, int64_t moment,
          const std::function<bool()>& cancelled)
        : file_(place.FileOf(order.share)),
          settings_(place.settings),
          order_(order),
          whole_(IsWhole(order)),
          folder_(FolderOf(order.share)) {
        Try([&] {
            if (!folder_.empty()) {
                whole_ ? ListAll(moment, cancelled) : ListPaths(cancelled);
            }
        });
    }

    void Ended(const programs::RunResult& result) {
        Try([&] { End(result); });
    }

    const std::string& Folder() const { return folder_; }
    /// Files that have other names and were sent, by inode.
    const std::map<uint64_t, std::string>& Linked() const { return linked_; }

private:
    template <typename Step>
    void Try(Step step) {
        try {
            step();
        } catch (const std::exception& error) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] zel_daemon(%d): share '%s': what its copy has cannot be "
                           "noted in %s (%s); it is compared whole when the daemon starts again\n",
                           __LINE__, programs::Printable(order_.share).c_str(), file_.c_str(),
                           error.what());
            is_kept_ = false;
            linked_.clear();
            index_.reset();
            FileIndex::Remove(file_);
        }
    }

    void ListAll(int64_t moment, const std::function<bool()>& cancelled) {
        notes_ = programs::ReadShareNotes(order_.share);
        index_.emplace(file_);
        index_->Clear();
        TreeList list(folder_, programs::kWholeShare, cancelled);
        TreeList::Entry entry;
        for (auto found = list.Next(entry); found != TreeList::Found::kEnd;
             found = list.Next(entry)) {
            if (found == TreeList::Found::kEntry) {  // what cannot be read will fail the run
                index_->Append(KeyOf(entry.path), entry.facts);
            }
        }
        index_->EndAppending();
        stamp_.compared = moment;
        is_kept_ = !cancelled();
    }

    void ListPaths(const std::function<bool()>& cancelled) {
        if (!FileIndex::Exists(file_)) {
            return;
        }
        notes_ = programs::ReadShareNotes(order_.share);
        FileIndex index(file_);
        const std::optional<IndexStamp> stamp = index.Stamp();
        if (!stamp || !IsInStep(*stamp, notes_, settings_)) {
            index.Forget();
            return;
        }
        stamp_ = *stamp;
        is_kept_ = true;
        const Transaction reading = index.Reading();
        KnownFiles known(index, order_.moves);
        const base::UniqueFd share = OpenShareFolder(folder_);
        FindLittleChanged(index, share, cancelled);
        std::vector<std::string> keys;
        for (const std::string& path : order_.paths) {
            keys.push_back(KeyOf(path));
        }
        std::sort(keys.begin(), keys.end());
        // The share's own folder is sent along with what is right in it alone.
        if (std::any_of(keys.begin(), keys.end(),
                        [](const std::string& key) { return ParentOf(key).empty(); })) {
            NoteFolder(share, "");
        }
        std::string noted;  // the folder that was noted last
        std::optional<std::string> done;
        for (const std::string& key : keys) {
            if (done && IsWithin(key, *done)) {
                continue;
            }
            done = key;
            NoteFolders(share, std::string(ParentOf(key)), noted);
            if (const auto untouched = untouched_.find(key); untouched != untouched_.end()) {
                changes_.Move(untouched->second, key);
                NoteFolder(share, key);
                continue;
            }
            changes_.Replace(key);
            const auto moved = moved_.find(key);
            if (moved != moved_.end()) {
                ChunkReader entries(moved->second);
                for (IndexEntry entry; entries.Next(entry);) {
                    Note(entry, known, key);
                }
            } else {
                const auto facts = FactsAt(share, PathOf(key));
                if (facts && facts->IsFolder()) {
                    NoteTree(key, known, cancelled);
                } else if (facts) {
                    Note({key, *facts}, known, key);
                }
            }
            if (changes_.Bytes() > kMostBytes) {
                throw programs::Failure("too many changes at once");
            }
        }
        moved_.clear();
        is_kept_ = !cancelled();
    }

    // `ordered`: the key of the path that it belongs to.
    void Note(const IndexEntry& entry, KnownFiles& known, const std::string& ordered) {
        changes_.Put(entry.key, entry.facts);
        if (entry.facts.linked && linked_.size() < kMostLinked) {
            linked_.emplace(entry.facts.inode, PathOf(entry.key));
        }
        if (known.IsDoubtful(entry)) {
            Doubt(entry, ordered);
        }
    }

    void Doubt(const IndexEntry& file, const std::string& ordered) {
        if (order_.doubtful.size() < kMostDoubtful &&
            file.facts.size <= kMostDoubtfulBytes - doubtful_bytes_) {
            doubtful_bytes_ += file.facts.size;
            order_.doubtful.push_back({PathOf(file.key), PathOf(ordered)});
        }
    }

    void NoteTree(const std::string& key, KnownFiles& known,
                  const std::function<bool()>& cancelled) {
        TreeList list(folder_, PathOf(key), cancelled);
        TreeList::Entry entry;
        for (auto found = list.Next(entry); found != TreeList::Found::kEnd;
             found = list.Next(entry)) {
            if (found == TreeList::Found::kEntry) {
                Note({KeyOf(entry.path), entry.facts}, known, key);
            }
        }
    }

    void FindLittleChanged(FileIndex& index, const base::UniqueFd& share,
                           const std::function<bool()>& cancelled) {
        for (const size_t i : AloneIn(order_.moves)) {
            programs::ShareMove& move = order_.moves[i];
            if (!move.is_settled) {
                continue;
            }
            const auto file =
                move.is_untouched ? FileOfUntouched(index, share, move) : std::nullopt;
            if (file) {
                move.instead = {*file};
                untouched_.emplace(KeyOf(move.to), KeyOf(move.from));
                continue;
            }
            MovedFolder seen = LookAtMoved(index, folder_, move, kMostBytes, cancelled);
            if (!seen.files.empty()) {
                move.instead = std::move(seen.files);
                moved_.emplace(KeyOf(move.to), std::move(seen.entries));
            }
        }
    }

    // The folders on the way to this one are sent along, and it as well.
    void NoteFolders(const base::UniqueFd& share, const std::string& folder, std::string& noted) {
        for (size_t end = 1; end < folder.size(); ++end) {
            end = std::min(folder.find('\0', end), folder.size());
            const std::string above = folder.substr(0, end);
            if (!IsWithin(noted, above)) {
                NoteFolder(share, above);
            }
        }
        noted = folder;
    }

    void NoteFolder(const base::UniqueFd& share, const std::string& key) {
        if (const auto facts = FactsAt(share, PathOf(key))) {
            changes_.Put(key, *facts);
        }
    }

    void End(const programs::RunResult& result) {
        const auto pushed = result.pushes.find(order_.share);
        if (!is_kept_ || pushed == result.pushes.end()) {
            linked_.clear();  // nothing was begun: what was in step is so still
            return;
        }
        bool broke_off = false;
        std::vector<std::string> undone;
        for (const programs::Undone& item : result.undone) {
            if (item.share == order_.share) {
                broke_off = broke_off || BrokeOff(item.failure);
                std::transform(item.paths.begin(), item.paths.end(), std::back_inserter(undone),
                               KeyOf);
            }
        }
        const programs::ShareNotes now = programs::ReadShareNotes(order_.share);
        const auto copy = CopyAfter(notes_, now, pushed->second,
                                    whole_ ? std::nullopt : std::optional(stamp_.copy));
        if (!whole_) {
            index_.emplace(file_);
        }
        if (broke_off || !copy || (whole_ && !undone.empty())) {
            linked_.clear();
            index_->Forget();
            return;
        }
        stamp_.settings = settings_;
        stamp_.copy = *copy;
        stamp_.begun = now.begun;
        whole_ ? index_->SetStamp(stamp_) : index_->Change(changes_, undone, stamp_);
        index_.reset();
    }

    const std::string file_;
    const std::string settings_;
    ShareOrder& order_;
    const bool whole_;
    const std::string folder_;
    bool is_kept_ = false;        // what the run sends can go into the index
    programs::ShareNotes notes_;  // before the run
    IndexStamp stamp_;
    IndexChanges changes_;
    uint64_t doubtful_bytes_ = 0;               // of ShareOrder::doubtful
    std::map<std::string, std::string> moved_;  // MovedFolder::entries, by the key of their place
    // Of folders that were moved and not looked at, the key of the old place by the new one's.
    std::map<std::string, std::string> untouched_;
    std::optional<FileIndex> index_;
    std::map<uint64_t, std::string> linked_;
};

RunIndexes::RunIndexes(IndexPlace place, programs::RunOrder& order, int64_t moment,
                       const std::function<bool()>& cancelled)
    : place_(std::move(place)) {
    if (place_.folder.empty()) {
        return;
    }
    for (ShareOrder& share : order.shares) {
        shares_.push_back(std::make_unique<Share>(place_, share, moment, cancelled));
    }
}

RunIndexes::~RunIndexes() = default;

RunIndexes::Linked RunIndexes::Ended(const programs::RunResult& result) {
    for (const auto& share : shares_) {
        share->Ended(result);
    }
    Linked linked;
    FindLinked(linked);
    return linked;
}

// Of all files that were sent and have other names, those names.
void RunIndexes::FindLinked(Linked& linked) const {
    std::vector<LinkedFile> files;
    for (const auto& share : shares_) {
        for (const auto& [inode, path] : share->Linked()) {
            const std::string name = share->Folder() + path;
            LinkedFile file;
            const auto facts = FactsOf(AT_FDCWD, name.c_str(), LookTime());
            if (facts && facts->inode == inode && lstat(name.c_str(), &file.status) == 0) {
                file.facts = *facts;
                files.push_back(file);
            }
        }
    }
    std::error_code ignored;
    for (fs::directory_iterator at(place_.folder, ignored), end;
         !files.empty() && !ignored && at != end; at.increment(ignored)) {
        const std::string name = at->path().filename();
        const auto share = base::PercentDecoded(name.substr(0, name.rfind('.')));
        const std::string folder = share ? FolderOf(*share) : "";
        if (!folder.empty() && at->path() == place_.FileOf(*share)) {
            FindOtherNames(at->path(), *share, folder, files, linked);
        }
    }
}

}  // namespace zel_daemon

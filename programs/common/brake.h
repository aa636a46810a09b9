// The brake: what a share's push would lose at the server, and whether that is so much that a
// person is asked first. A file of the copy is lost when it is deleted or its content replaced.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "programs/common/question.h"
#include "tarq/rsync_wrapper.h"

namespace programs {

/// The `reason` of the brake's questions.
constexpr const char* kLosses = "losses";

/// A file of a copy, by its path in the share, relative to it.
using PathHash = uint64_t;
PathHash HashOf(std::string_view path);

/// What a push has changed in a copy. Folders do not count as files.
struct CopyChanges {
    std::vector<PathHash> born;     ///< files that were not there
    std::vector<PathHash> lost;     ///< files that were deleted or replaced
    int64_t growth = 0;             ///< files made, less those deleted
    std::optional<uint64_t> files;  ///< in the copy, after a push of all of the share

    void Add(const TARQ::Backup::RunChange& change);
};

/// What a copy has lost within a day: floods that come bit by bit, each bit below the limit. A file
/// is counted once, and one that came to the copy within that day not at all, so that temporary
/// files and files that are written all the time do not add up.
class RecentLosses {
public:
    static constexpr int64_t kSeconds = int64_t{24} * 3600;
    /// More files that came are not remembered; their loss counts then.
    static constexpr size_t kMaxBorn = 200000;

    /// `now` in seconds, on a clock that does not go back.
    void Add(const CopyChanges& changes, int64_t now);
    void Clear();
    /// Whether the file's loss would be one more.
    bool IsMore(PathHash file) const { return born_.count(file) == 0 && lost_.count(file) == 0; }
    uint64_t Count() const { return lost_.size(); }

private:
    std::unordered_map<PathHash, int64_t> born_;  // and since when
    std::unordered_map<PathHash, int64_t> lost_;
    int64_t forgotten_ = 0;  // when what is old was last forgotten
};

/// How the push of one share is checked.
struct Brake {
    unsigned int percent = 0;  ///< of the copy's files that may be lost; 0: any number
    /// Files in the copy, as the last push has left it; nothing: that is not known.
    std::optional<uint64_t> files = {};
    /// So many can be lost at most, from what is known of the changes; nothing: any number.
    std::optional<uint64_t> at_most = {};
    /// And besides, folders that went with all that was in them.
    std::set<std::string> folders = {};
    bool is_known = false;  ///< this machine has pushed into this copy before
    std::shared_ptr<const RecentLosses> recent = {};  ///< may be null

    /// How many files a push may lose of a copy with so many.
    uint64_t Limit(uint64_t of_files) const;
    /// Whether the push could lose too much, so that it has to be found out what it would do.
    bool MustLook() const;
};

/// What a push would lose, from the changes of a dry run.
class LossCount {
public:
    /// `folder`: the share's.
    LossCount(const Brake& brake, std::string folder);

    void Add(const TARQ::Backup::RunChange& change);
    /// A file of the copy, from a listing of it: takes back its loss when it only goes to another
    /// place, where a file of the same size and time is sent.
    void AddOfCopy(const TARQ::Backup::RunChange& file);

    bool FindsNothing() const { return nothing_; }
    uint64_t Deleted() const { return deleted_; }
    /// Whether so much would be lost of a copy with `files` files.
    bool IsTooMuch(uint64_t files) const;
    /// Files of a copy whose share has `in_share` files.
    uint64_t FilesOfCopy(uint64_t in_share) const;
    /// Whether a person has allowed as much.
    bool IsAllowed(const std::optional<Consent>& consent) const;
    Question ToQuestion(const std::string& share, uint64_t files) const;

private:
    uint64_t Lost() const { return deleted_ + replaced_; }

    const Brake brake_;
    const std::string folder_;
    bool nothing_ = true;
    uint64_t deleted_ = 0;
    uint64_t replaced_ = 0;
    uint64_t moved_ = 0;
    uint64_t made_ = 0;
    uint64_t more_recent_ = 0;                     // that have not been lost within the day
    std::unordered_set<PathHash> gone_;            // paths of the deleted
    std::unordered_map<uint64_t, uint64_t> sent_;  // how many new files, by size and time
    std::vector<std::string> list_;
};

}  // namespace programs

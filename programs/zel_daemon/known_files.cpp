#include "programs/zel_daemon/known_files.h"

#include <sys/stat.h>

#include <algorithm>
#include <optional>
#include <string_view>

#include "programs/zel_daemon/path_key.h"

namespace zel_daemon {

namespace {

bool IsOther(const EntryFacts* was, const EntryFacts& is) {
    return was != nullptr && S_ISREG(was->mode) && is.inode != was->inode && is.size == was->size &&
           is.modified == was->modified;
}

}  // namespace

KnownFiles::KnownFiles(FileIndex& index, const std::vector<programs::ShareMove>& moves)
    : here_(index), before_(index) {
    for (const programs::ShareMove& move : moves) {
        by_place_[KeyOf(move.to)].push_back(froms_.size());
        froms_.push_back(KeyOf(move.from));
    }
}

// Takes the last of the first `count` moves back that has brought this key where it is; `count` are
// those before it. False: there is none.
bool KnownFiles::TakeBack(std::string& key, size_t& count) const {
    std::optional<size_t> last;
    size_t place = 0;
    for (std::string_view above = key; !above.empty() && !by_place_.empty();
         above = ParentOf(above)) {
        const auto found = by_place_.find(std::string(above));
        if (found == by_place_.end()) {
            continue;
        }
        const std::vector<size_t>& moves = found->second;
        const auto end = std::lower_bound(moves.begin(), moves.end(), count);
        if (end != moves.begin() && (!last || *last < *(end - 1))) {
            last = *(end - 1);
            place = above.size();
        }
    }
    if (last) {
        key.replace(0, place, froms_[*last]);
        count = *last;
    }
    return last.has_value();
}

bool KnownFiles::IsDoubtful(const IndexEntry& file) {
    if (!S_ISREG(file.facts.mode) || file.facts.size == 0) {
        return false;
    }
    bool is_other = IsOther(here_.Find(file.key), file.facts);
    std::string before = file.key;
    // What the server does not move over something may stay.
    for (size_t moves = froms_.size(); !is_other && TakeBack(before, moves);) {
        is_other = IsOther(before_.Find(before), file.facts);
    }
    return is_other;
}

}  // namespace zel_daemon

#include "programs/zel_daemon/known_files.h"

#include <sys/stat.h>

#include <algorithm>
#include <iterator>

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
    std::transform(moves.rbegin(), moves.rend(), std::back_inserter(moves_),
                   [](const programs::ShareMove& move) {
                       return std::make_pair(KeyOf(move.from), KeyOf(move.to));
                   });
}

bool KnownFiles::IsDoubtful(const IndexEntry& file) {
    if (!S_ISREG(file.facts.mode) || file.facts.size == 0) {
        return false;
    }
    bool is_other = IsOther(here_.Find(file.key), file.facts);
    std::string before = file.key;
    for (const auto& [from, to] : moves_) {
        if (IsWithin(before, to)) {  // what the server does not move over something may stay
            before.replace(0, to.size(), from);
            is_other = is_other || IsOther(before_.Find(before), file.facts);
        }
    }
    return is_other;
}

}  // namespace zel_daemon

#include "programs/zel_daemon/move_ledger.h"

#include <algorithm>
#include <string_view>

#include "programs/common/mounts_below.h"
#include "programs/zel_daemon/path_key.h"

namespace zel_daemon {

namespace {

using programs::ShareMove;

// So many moves of a share are kept until they are stored; what else was moved is sent.
constexpr size_t kMaxMoves = 1024;

// Whether what is at the path has come there, or a folder above it, by one of these.
bool WasMovedTo(const std::vector<ShareMove>& moves, const std::string& path) {
    return std::any_of(moves.begin(), moves.end(), [&path](const ShareMove& move) {
        return programs::IsAtOrBelow(path, move.to);
    });
}

}  // namespace

void MoveLedger::Changed(const std::string& share, const std::string& path) {
    const auto found = untouched_.find(share);
    if (found == untouched_.end()) {
        return;
    }
    std::set<std::string>& places = found->second;
    const std::string key = KeyOf(path);
    auto below = places.lower_bound(key);
    while (below != places.end() && IsWithin(*below, key)) {
        below = places.erase(below);
    }
    for (std::string_view above = key; !above.empty();) {
        above = ParentOf(above);
        places.erase(std::string(above));
    }
    if (places.empty()) {
        untouched_.erase(found);
    }
}

void MoveLedger::Moved(const std::string& share, const std::string& from, const std::string& to,
                       bool is_new, bool is_in_step) {
    std::vector<ShareMove>& moves = waiting_[share];
    const bool goes_on = !moves.empty() && moves.back().to == from;
    const bool is_untouched =
        may_settle_ && (goes_on ? untouched_[share].count(KeyOf(from)) != 0 : is_in_step);
    if (goes_on && moves.back().from == to) {
        moves.pop_back();
    } else if (goes_on) {
        moves.back().to = to;
        moves.back().is_settled = moves.back().is_settled && may_settle_;
    } else if (!is_new || WasMovedTo(moves, from)) {
        moves.push_back({from, to, {}, may_settle_});
    }  // else it is not at the server yet
    if (moves.size() > kMaxMoves) {
        moves.erase(moves.begin());
    }
    Changed(share, from);
    Changed(share, to);
    if (is_untouched && untouched_[share].size() < kMaxMoves) {
        untouched_[share].insert(KeyOf(to));
    }
}

void MoveLedger::Stored() {
    for (const auto& [share, moves] : waiting_) {
        auto& settled = settled_[share];
        for (const ShareMove& move : moves) {
            const std::pair ends(move.from, move.to);
            settled.erase(ends);
            if (move.is_settled && settled.size() < kMaxMoves) {
                settled.insert(ends);
            }
        }
    }
    waiting_.clear();
}

void MoveLedger::DropWaiting() {
    waiting_.clear();
    untouched_.clear();
}

void MoveLedger::Mark(const std::string& share, ShareMove& move) const {
    const auto settled = settled_.find(share);
    const auto untouched = untouched_.find(share);
    move.is_settled = settled != settled_.end() && settled->second.count({move.from, move.to}) != 0;
    move.is_untouched = move.is_settled && untouched != untouched_.end() &&
                        untouched->second.count(KeyOf(move.to)) != 0;
}

void MoveLedger::Forget(const std::string& share, const ShareMove& move) {
    settled_[share].erase({move.from, move.to});
    untouched_[share].erase(KeyOf(move.to));
}

}  // namespace zel_daemon

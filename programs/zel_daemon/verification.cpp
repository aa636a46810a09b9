#include "programs/zel_daemon/verification.h"

#include <algorithm>
#include <unordered_set>
#include <utility>

namespace zel_daemon {

namespace {

constexpr int64_t kDay = int64_t{24} * 3600;
// Of the period a round leaves this part for what comes between.
constexpr double kSpread = 0.9;

double PartOf(uint64_t done, uint64_t all) {
    return all == 0 ? 0 : std::min(1.0, static_cast<double>(done) / static_cast<double>(all));
}

}  // namespace

void Verification::Set(const std::list<std::string>& shares, unsigned int days, bool others) {
    Shares kept;
    for (const std::string& share : shares) {
        const auto known = shares_.find(share);
        kept[share] = known == shares_.end() || others ? Share() : std::move(known->second);
    }
    shares_ = std::move(kept);
    period_ = days * kDay;
}

void Verification::Restore(Shares shares) {
    for (auto& [name, share] : shares_) {
        if (const auto known = shares.find(name); known != shares.end()) {
            share = std::move(known->second);
        }
    }
}

// A clock that was set back neither holds up a round nor begins it anew.
int64_t Verification::DueAt(const VerifyRound& round, int64_t now) const {
    const int64_t begun = std::min(round.begun, now);
    if (round.begun == 0) {
        return now;
    }
    if (!round.goes_on) {
        return begun + period_;
    }
    const double part =
        std::max(PartOf(round.bytes, round.all_bytes), PartOf(round.files, round.all_files));
    return begun + static_cast<int64_t>(static_cast<double>(period_) * part * kSpread);
}

std::optional<std::string> Verification::Due(
    int64_t now, const std::function<bool(const std::string& share)>& may) const {
    std::optional<std::string> first;
    int64_t first_at = now;
    if (period_ == 0) {
        return first;
    }
    for (const auto& [name, share] : shares_) {
        const int64_t at = DueAt(share.round, now);
        if ((first ? at < first_at : at <= now) && may(name)) {
            first = name;
            first_at = at;
        }
    }
    return first;
}

std::optional<int64_t> Verification::Next(int64_t now) const {
    std::optional<int64_t> next;
    for (const auto& [name, share] : shares_) {
        const int64_t at = DueAt(share.round, now);
        next = std::min(next.value_or(at), at);
    }
    return period_ == 0 ? std::nullopt : next;
}

VerifyRound Verification::RoundAt(const std::string& share, int64_t now) const {
    VerifyRound round = shares_.at(share).round;
    if (!round.goes_on) {
        round.begun = now;
        round.goes_on = true;
        round.place.clear();
        round.files = 0;
        round.bytes = 0;
    }
    round.begun = std::min(round.begun, now);
    return round;
}

const std::map<std::string, uint64_t>& Verification::DamagedIn(const std::string& share) const {
    return shares_.at(share).damaged;
}

void Verification::Done(const std::string& share, const VerifiedSlice& slice) {
    Share& known = shares_.at(share);
    known.round = slice.round;
    for (const std::string& path : slice.well) {
        known.damaged.erase(path);
    }
    known.damaged.insert(slice.damaged.begin(), slice.damaged.end());
}

std::vector<std::string> Verification::Replaced(const std::string& share,
                                                const programs::CopyChanges& changes) const {
    std::vector<std::string> replaced;
    const auto known = shares_.find(share);
    if (known == shares_.end() || known->second.damaged.empty()) {
        return replaced;
    }
    const std::unordered_set<programs::PathHash> lost(changes.lost.begin(), changes.lost.end());
    for (const auto& [path, length] : known->second.damaged) {
        if (lost.count(programs::HashOf(path)) != 0) {
            replaced.push_back(path);
        }
    }
    return replaced;
}

std::optional<int64_t> Verification::LastVerified() const {
    std::optional<int64_t> oldest;
    for (const auto& [name, share] : shares_) {
        oldest = std::min(oldest.value_or(share.round.ended), share.round.ended);
    }
    return oldest == 0 ? std::nullopt : oldest;
}

size_t Verification::Damaged() const {
    size_t count = 0;
    for (const auto& [name, share] : shares_) {
        count += share.damaged.size();
    }
    return count;
}

}  // namespace zel_daemon

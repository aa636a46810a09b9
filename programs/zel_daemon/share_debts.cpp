#include "programs/zel_daemon/share_debts.h"

#include <algorithm>
#include <limits>

#include "tarq/rsync_wrapper.h"

namespace zel_daemon {

namespace {

using programs::FailureKind;
using programs::Reach;

constexpr int64_t kAtOnce = std::numeric_limits<int64_t>::min();
// A share that is always busy is tried this often, at least.
constexpr int64_t kLongestBusyMs = 60000;

void TakeEarlier(std::optional<int64_t>& soonest, std::optional<int64_t> moment) {
    if (moment && (!soonest || *moment < *soonest)) {
        soonest = moment;
    }
}

}  // namespace

bool BrokeOff(const programs::RunFailure& failure) {
    return failure.reach == Reach::kShare &&
           (failure.Status() == TARQ::Backup::STATUS_SOCKET ||
            failure.Status() == TARQ::Backup::STATUS_PROTOCOL_STREAM ||
            failure.Status() == TARQ::Backup::STATUS_TIMEOUT);
}

std::optional<int64_t> ShareDebts::Share::Next() const {
    if (!Owes()) {
        return std::nullopt;
    }
    const bool unfailed = (state == ShareState::kUnknown && !resync_failed) || fresh;
    return retry.Waiting() && (shut || !unfailed) ? retry.At() : kAtOnce;
}

bool ShareDebts::Share::MayTry(int64_t now) const {
    const std::optional<int64_t> next = Next();
    return next && *next <= now;
}

void ShareDebts::SetShares(const std::list<std::string>& shares) {
    shares_.clear();
    taken_.clear();
    sums_.reset();
    for (const std::string& share : shares) {
        shares_[share];
    }
}

ShareDebts::Share* ShareDebts::Changed(const std::string& share) {
    const auto found = shares_.find(share);
    if (found == shares_.end()) {
        return nullptr;
    }
    sums_.reset();
    return &found->second;
}

void ShareDebts::OweResync(const std::string& share) {
    Share* const owed = Changed(share);
    if (owed != nullptr && owed->state == ShareState::kTracked) {
        owed->state = ShareState::kUnknown;
        owed->resync_failed = false;
    }
}

void ShareDebts::OweResyncs() {
    for (const auto& [name, share] : shares_) {
        OweResync(name);
    }
}

void ShareDebts::OweChanges(const std::string& share) {
    if (Share* const owed = Changed(share)) {
        owed->fresh = true;
    }
}

void ShareDebts::Forgive() {
    for (auto& [name, share] : shares_) {
        share = {};
    }
    sums_.reset();
}

void ShareDebts::Release() {
    for (auto& [name, share] : shares_) {
        share.retry.Release();
    }
    sums_.reset();
}

void ShareDebts::Hasten(int64_t now, int64_t gap,
                        const std::function<bool(const std::string& share, FailureKind)>& fits) {
    for (auto& [name, share] : shares_) {
        if (share.retry.Waiting() && fits(name, share.kind)) {
            share.retry.Hasten(now, gap);
            sums_.reset();
        }
    }
}

const ShareDebts::Sums& ShareDebts::Summed() const {
    if (!sums_) {
        sums_ = Sums();
        for (const auto& [name, share] : shares_) {
            TakeEarlier(sums_->next, share.Next());
            if (share.retry.Waiting()) {
                TakeEarlier(sums_->next_retry, share.retry.At());
                if (sums_->waiting.shares++ == 0) {
                    sums_->waiting.first = name;
                    sums_->waiting.kind = share.kind;
                }
            }
        }
    }
    return *sums_;
}

std::optional<int64_t> ShareDebts::Next() const {
    return Summed().next;
}

std::optional<int64_t> ShareDebts::NextRetry() const {
    return Summed().next_retry;
}

ShareDebts::Waiting ShareDebts::WhatWaits() const {
    return Summed().waiting;
}

bool ShareDebts::AnyDue(int64_t now,
                        const std::function<bool(const std::string& share)>& test) const {
    return std::any_of(shares_.begin(), shares_.end(), [&](const auto& entry) {
        return entry.second.MayTry(now) && test(entry.first);
    });
}

std::vector<ShareDebts::Due> ShareDebts::Take(int64_t now) {
    std::vector<Due> taken;
    for (auto& [name, share] : shares_) {
        if (!share.MayTry(now)) {
            continue;
        }
        const bool ripe = !share.retry.Waiting() || share.retry.Due(now);
        Due due;
        due.share = name;
        due.resync = share.state == ShareState::kUnknown && (!share.resync_failed || ripe);
        due.stored = share.fresh || share.failed_upto != 0;
        due.after = due.resync || ripe ? 0 : share.failed_upto;
        due.again = share.retry.Failures() > 0 && (ripe || due.resync);
        due.rest_waits = !due.resync && !ripe;
        share.fresh = false;
        if (due.resync) {
            share.state = ShareState::kTracked;
        }
        if (due.again) {
            share.failed_upto = 0;
            share.shut = false;
            share.retry.Release();
        }
        taken_[name] = due;
        taken.push_back(std::move(due));
    }
    sums_.reset();
    return taken;
}

void ShareDebts::Settle(int64_t now, const std::map<std::string, Outcome>& outcomes,
                        const RetryDelays& delays, double chance) {
    for (const auto& [name, due] : taken_) {
        Share* const share = Changed(name);
        const auto found = outcomes.find(name);
        const Outcome outcome = found == outcomes.end() ? Outcome() : found->second;
        if (share == nullptr) {
            continue;
        }
        if (!outcome.tried) {
            share->fresh = share->fresh || due.stored;
            if (due.resync) {
                OweResync(name);
            }
        } else if (outcome.failed) {
            if (due.resync || outcome.broke_off) {
                share->state = ShareState::kUnknown;
                share->resync_failed = true;
            }
            share->failed_upto = std::max(share->failed_upto, outcome.last_change);
            share->shut = outcome.reach != Reach::kPaths;
            share->kind = outcome.kind;
            // What waited already does not wait longer for what has come to it.
            if (!share->retry.Waiting()) {
                RetryDelays waits = delays;
                if (outcome.kind == FailureKind::kBusy) {
                    waits.longest = std::min(waits.longest, kLongestBusyMs);
                } else if (outcome.kind == FailureKind::kConfirm) {
                    waits.first = waits.longest;  // only now and then: each look costs a dry run
                }
                share->retry.Failed(now, waits, chance);
            }
        } else if (!share->retry.Waiting()) {
            share->retry.Settled();
            share->kind = FailureKind::kNone;
        }
    }
    taken_.clear();
}

}  // namespace zel_daemon

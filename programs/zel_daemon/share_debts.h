// What one task owes its server, share by share, and when each share may be tried.
#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "programs/common/run_result.h"
#include "programs/zel_daemon/backoff.h"

namespace zel_daemon {

/// Whether the receiver may have died in the midst of a copy, and left what it had of a file.
bool BrokeOff(const programs::RunFailure& failure);

/// What is known of what changed in a share since its last full resync.
enum class ShareState {
    kTracked,  ///< all of it, as stored changes: they are all that is owed
    kUnknown   ///< not all: the next run is a full resync of the share
};

/// What is owed may be tried at once, until a try fails. Then
///
/// - what failed waits for its next try, and a change that is stored later does not wait with it;
/// - unless the failure was one of the whole share (its volume is away, the server refuses it):
///   then all of it waits.
///
/// A failure of the whole run puts everything back as it was; TaskPlan knows when the run is tried
/// again. Changes are known by their number in the store: those up to `after` have failed before.
///
/// Costs: Next() and Wait() look at each share only after something has changed, and at none
/// otherwise.
///
/// Threads: one thread. Moments are in milliseconds on a clock that never jumps.
class ShareDebts {
public:
    /// What may be tried of one share.
    struct Due {
        std::string share;
        bool resync = false;      ///< in full
        bool stored = false;      ///< there are changes in the store, or may be
        uint64_t after = 0;       ///< those up to here are left out
        bool again = false;       ///< some of it has failed before
        bool rest_waits = false;  ///< something else of the share waits for its next try
    };
    /// What became of one share that was taken.
    struct Outcome {
        bool tried = true;  ///< false: it is owed as it was
        bool failed = false;
        bool broke_off = false;  ///< the server may have kept something of it: a resync is owed
        programs::Reach reach = programs::Reach::kPaths;
        programs::FailureKind kind = programs::FailureKind::kNone;
        uint64_t last_change = 0;  ///< the highest number of its changes that failed
    };
    /// What waits for its next try, for a person.
    struct Waiting {
        size_t shares = 0;
        std::string first;                                          ///< one of them
        programs::FailureKind kind = programs::FailureKind::kNone;  ///< that one's
    };

    /// Forgets what is owed, and begins with these.
    void SetShares(const std::list<std::string>& shares);
    bool Has(const std::string& share) const { return shares_.count(share) != 0; }
    /// REQUIRES Has().
    bool Owes(const std::string& share) const { return shares_.at(share).Owes(); }
    /// REQUIRES Has(). While a run sends the share it counts as sent.
    ShareState StateOf(const std::string& share) const { return shares_.at(share).state; }

    /// The share's state, or that of all shares, is kUnknown from now on.
    void OweResync(const std::string& share);
    void OweResyncs();
    /// Changes of the share have been stored.
    void OweChanges(const std::string& share);
    /// Nothing is owed any more.
    void Forgive();
    /// Nothing waits any more: what is owed may be tried at once.
    void Release();
    /// What these shares failed for may be over, see Backoff. `fits` is asked for each that waits.
    void Hasten(int64_t now, int64_t gap,
                const std::function<bool(const std::string& share, programs::FailureKind)>& fits);

    /// When something may be tried; now or earlier: at once. Nothing: never, as things are.
    std::optional<int64_t> Next() const;
    /// When the first of what failed is tried again.
    std::optional<int64_t> NextRetry() const;
    Waiting WhatWaits() const;
    /// Whether `test` holds for one of the shares that may be tried now.
    bool AnyDue(int64_t now, const std::function<bool(const std::string& share)>& test) const;

    /// A run begins with all that may be tried now, until Settle().
    std::vector<Due> Take(int64_t now);
    /// How it ended, for each share taken; those that `outcomes` leaves out went well.
    void Settle(int64_t now, const std::map<std::string, Outcome>& outcomes,
                const RetryDelays& delays, double chance);

private:
    struct Share {
        ShareState state = ShareState::kTracked;
        bool resync_failed = false;  // it waits for its next try with what else failed
        bool fresh = false;          // changes are stored that have not failed
        uint64_t failed_upto = 0;    // those up to this number have; 0: none
        bool shut = false;           // and keep all else from being tried
        Backoff retry;
        programs::FailureKind kind = programs::FailureKind::kNone;

        bool Owes() const { return state == ShareState::kUnknown || fresh || failed_upto != 0; }
        bool MayTry(int64_t now) const;
        std::optional<int64_t> Next() const;
    };
    struct Sums {
        std::optional<int64_t> next;
        std::optional<int64_t> next_retry;
        Waiting waiting;
    };
    const Sums& Summed() const;
    Share* Changed(const std::string& share);

    std::map<std::string, Share> shares_;
    std::map<std::string, Due> taken_;
    mutable std::optional<Sums> sums_;  // nothing: to be made anew
};

}  // namespace zel_daemon

// How far the copies of one task are verified, and what was found.
#pragma once

#include <cstdint>
#include <functional>
#include <list>
#include <map>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "programs/common/brake.h"

namespace zel_daemon {

/// One round through a share: each of its files is read at both ends once. Times are in seconds
/// since the epoch, as people's clocks show it.
struct VerifyRound {
    int64_t begun = 0;     ///< the round that goes on, or the last one; 0: there was none
    int64_t ended = 0;     ///< the last round that has ended did so then; 0: none has
    bool goes_on = false;  ///< it has not ended
    std::string place;     ///< all up to this entry has been read; empty: nothing
    uint64_t files = 0;    ///< read in this round
    uint64_t bytes = 0;
    uint64_t all_files = 0;  ///< of a round: as the last one had, or else no more than this
    uint64_t all_bytes = 0;
};

/// What one slice came to.
struct VerifiedSlice {
    VerifyRound round;                        ///< after it
    std::map<std::string, uint64_t> damaged;  ///< files with other bytes, with their length
    std::vector<std::string> well;            ///< files known to be damaged that are not any more
    bool ends_round = false;
};

/// The rounds of one task's shares. The slices of a round are spread over the first nine tenths of
/// the period, by how much of the share they have read; what was missed is made up for as fast as
/// may be.
///
/// Threads: one thread.
class Verification {
public:
    /// A round, and the damaged files, of a share.
    struct Share {
        VerifyRound round;
        std::map<std::string, uint64_t> damaged;  // by path in the share, with the length
    };
    using Shares = std::map<std::string, Share>;

    /// More damaged files of a share are counted as these.
    static constexpr size_t kMaxDamaged = 1000;

    /// The task has these shares from now on; `others`: and their copies are others. `days`: the
    /// period; 0: none is verified.
    void Set(const std::list<std::string>& shares, unsigned int days, bool others);
    void Restore(Shares shares);

    /// The share whose slice is due first, of those that `may`; nothing: none is due by now.
    std::optional<std::string> Due(int64_t now,
                                   const std::function<bool(const std::string& share)>& may) const;
    /// When the first slice is due; nothing: never.
    std::optional<int64_t> Next(int64_t now) const;

    /// The round as it is when a slice begins now. REQUIRES that the share is the task's.
    VerifyRound RoundAt(const std::string& share, int64_t now) const;
    const std::map<std::string, uint64_t>& DamagedIn(const std::string& share) const;
    /// A slice has ended, and is stored.
    void Done(const std::string& share, const VerifiedSlice& slice);

    /// Of the damaged files those of which a push has replaced or removed the copy.
    std::vector<std::string> Replaced(const std::string& share,
                                      const programs::CopyChanges& changes) const;
    bool Has(const std::string& share) const { return shares_.count(share) != 0; }

    const Shares& All() const { return shares_; }
    /// All shares' last rounds had ended by then; nothing: not all have had one.
    std::optional<int64_t> LastVerified() const;
    size_t Damaged() const;

private:
    int64_t DueAt(const VerifyRound& round, int64_t now) const;

    Shares shares_;
    int64_t period_ = 0;  // in seconds; 0: none
};

}  // namespace zel_daemon

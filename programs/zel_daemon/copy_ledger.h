// What one task knows of its copies at the server, so that its runs can be braked.
#pragma once

#include <cstdint>
#include <limits>
#include <list>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <utility>

#include "programs/common/run_result.h"

namespace zel_daemon {

/// By share: how many files the copy has, how many of them may have been lost since the last run,
/// and what it has lost within a day. The last two begin anew with the daemon.
///
/// Costs: a change is counted in logarithmic time; a run is handed some hundred names at most.
///
/// Threads: one thread, except that a run under way reads what it was handed.
class CopyLedger {
public:
    /// Known numbers of files in the copies, by share.
    using Files = std::map<std::string, uint64_t>;

    /// Forgets all other shares; `anew`: these, too.
    void SetShares(const std::list<std::string>& shares, bool anew);
    void Restore(const Files& files);

    /// A change was noticed: of one file, or, of a path that ends in "/", of a folder that went
    /// with all that was below it.
    void Changed(const std::string& share, const std::string& path);

    /// There are changes from before the daemon's start, nobody knows how many.
    void ChangedBefore(const std::string& share);

    /// How a run that begins now is braked. It holds until Settle() or PutBack().
    programs::Brake Take(const programs::ShareOrder& order, unsigned int percent);
    /// The run could not begin.
    void PutBack();
    /// How the run ended. `now` is in seconds, on a clock that does not go back. Returns the
    /// numbers of files that have changed.
    Files Settle(const programs::RunOrder& order, const programs::RunResult& result, int64_t now);

private:
    // More changes than any copy has files.
    static constexpr uint64_t kAny = std::numeric_limits<uint64_t>::max() / 2;

    struct Changes {
        void Add(Changes other);

        uint64_t files = 0;  // or kAny
        std::set<std::string> folders;
    };
    struct Copy {
        void PutBack() { changes.Add(std::exchange(taken, {})); }

        std::optional<uint64_t> files;
        Changes changes;  // since the last run began
        Changes taken;    // that the run under way sends
        std::shared_ptr<programs::RecentLosses> recent = std::make_shared<programs::RecentLosses>();
    };
    std::map<std::string, Copy> copies_;
};

}  // namespace zel_daemon

// What was moved in one task's shares, and what is certain of it.
#pragma once

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "programs/common/run_result.h"

namespace zel_daemon {

/// The moves that are not stored yet, and which of all of them are settled or untouched, see
/// programs::ShareMove, as far as this process knows: of what was stored before its start, none.
///
/// Costs: a change takes logarithmic time for each folder above it; a thousand moves of a share are
/// known at most, of the others less is certain.
///
/// Threads: one thread.
class MoveLedger {
public:
    /// Something has changed at the path, which may be anything below it.
    void Changed(const std::string& share, const std::string& path);
    /// Something in the share may have changed without a word.
    void MayHaveChanged(const std::string& share) { untouched_.erase(share); }
    /// What was at `from` is at `to` now. `is_new`: a change there waits, by which it may have
    /// come; `is_in_step`: the copy has it as it was there, and nothing says otherwise.
    void Moved(const std::string& share, const std::string& from, const std::string& to,
               bool is_new, bool is_in_step);

    /// A run begins: what is moved from now on may be on its way to the server.
    void RunBegins() { may_settle_ = false; }
    /// All that was moved until now has been told; no run is under way.
    void HeardAll() { may_settle_ = true; }

    /// Those of a share that are not stored yet, in their order.
    const std::vector<programs::ShareMove>& Waiting(const std::string& share) {
        return waiting_[share];
    }
    /// All of them are.
    void Stored();
    /// None is to be stored any more.
    void DropWaiting();

    /// Says of a stored move what is certain of it.
    void Mark(const std::string& share, programs::ShareMove& move) const;
    /// A stored move has been pushed.
    void Forget(const std::string& share, const programs::ShareMove& move);

private:
    template <typename Value>
    using ByShare = std::map<std::string, Value>;

    ByShare<std::vector<programs::ShareMove>> waiting_;
    ByShare<std::set<std::pair<std::string, std::string>>> settled_;  // from where to where
    ByShare<std::set<std::string>> untouched_;                        // keys of places
    bool may_settle_ = true;
};

}  // namespace zel_daemon

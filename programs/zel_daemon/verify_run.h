// One slice of a verification, read at both ends on a thread of its own.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <vector>

#include "ZEL/sync_obj.h"
#include "programs/zel_daemon/loop_worker.h"
#include "programs/zel_daemon/verification.h"
#include "programs/zel_daemon/verify_slice.h"

namespace zel_daemon {

struct VerifyOrder {
    uint64_t task_id = 0;
    std::string task;
    std::string share;
    ZEL::SyncInfo info;
    std::vector<std::string> excludes;
    VerifyRound round;                        ///< that the slice goes on with
    std::map<std::string, uint64_t> damaged;  ///< what is known to be
    SliceLimits limits;
};

struct VerifyOutcome {
    std::string problem;  ///< why nothing was verified; empty: it was
    VerifiedSlice slice;
    uint64_t bytes = 0;                  ///< that were read at each end
    std::vector<std::string> differing;  ///< files that are missing or other at the server
};

/// Threads: the loop's.
class VerifyRun {
public:
    using OnEnd = std::function<void(const VerifyOutcome&)>;

    /// Starts it; without a thread to be had it ends with that problem. `on_end` is called on the
    /// loop's thread, after this; never once this object is gone.
    VerifyRun(EventLoop& loop, VerifyOrder order, const OnEnd& on_end);
    /// Cancels and waits for the end.
    ~VerifyRun() { Cancel(); }
    VerifyRun(const VerifyRun&) = delete;
    VerifyRun& operator=(const VerifyRun&) = delete;

    /// Ends it soon, with a problem.
    void Cancel() { cancel_ = true; }
    bool Cancelled() const { return cancel_; }
    const VerifyOrder& Order() const { return order_; }

private:
    VerifyOutcome Work() const;
    void Compare(const std::vector<std::string>& files, VerifyOutcome& outcome) const;

    const VerifyOrder order_;
    std::atomic<bool> cancel_{false};
    LoopWorker worker_;
};

}  // namespace zel_daemon

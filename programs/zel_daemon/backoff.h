// When something that failed is tried again.
#pragma once

#include <cstdint>
#include <optional>

namespace zel_daemon {

/// How long what failed waits for its next try, in milliseconds: the first time, and at most.
struct RetryDelays {
    int64_t first = 10000;
    int64_t longest = 3600000;
};

/// The tries of one thing: each failure doubles the wait, up to the longest, and each wait is up to
/// a fifth shorter or longer so that many clients do not come back together. Moments are in
/// milliseconds on a clock that never jumps.
///
/// Threads: one thread.
class Backoff {
public:
    /// A try failed now. `chance`, from 0 to below 1, says how far the wait is from the middle.
    void Failed(int64_t now, const RetryDelays& delays, double chance);
    /// A try went well, or nobody wants another one.
    void Settled() { *this = {}; }
    /// What it failed for may be over: the next try comes at once, unless the last one was less
    /// than `gap` ago; then it comes after that. Never later than it would have.
    void Hasten(int64_t now, int64_t gap);
    /// The next try may come at once; how often it failed is kept.
    void Release() { at_.reset(); }

    bool Waiting() const { return at_.has_value(); }
    bool Due(int64_t now) const { return at_ && *at_ <= now; }
    std::optional<int64_t> At() const { return at_; }
    unsigned int Failures() const { return failures_; }

private:
    unsigned int failures_ = 0;
    int64_t failed_at_ = 0;
    std::optional<int64_t> at_;
};

}  // namespace zel_daemon

#include "programs/zel_daemon/backoff.h"

#include <algorithm>
#include <cmath>

namespace zel_daemon {

namespace {

constexpr double kJitter = 0.2;

}  // namespace

void Backoff::Failed(int64_t now, const RetryDelays& delays, double chance) {
    int64_t delay = delays.first;
    for (unsigned int i = 0; i < failures_ && delay < delays.longest; ++i) {
        delay *= 2;
    }
    delay = std::min(delay, delays.longest);
    ++failures_;
    failed_at_ = now;
    const double factor = 1 + kJitter * (2 * chance - 1);
    at_ = now + std::llround(static_cast<double>(delay) * factor);
}

void Backoff::Hasten(int64_t now, int64_t gap) {
    if (at_) {
        at_ = std::min(*at_, std::max(now, failed_at_ + gap));
    }
}

}  // namespace zel_daemon

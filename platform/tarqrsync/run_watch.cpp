#include "platform/tarqrsync/run_watch.h"

namespace TARQ {
namespace Backup {

namespace {

constexpr std::chrono::seconds kLookEvery(1);
// The keep-alive traffic of ssh and rsync between two checks is less than this.
constexpr uint64_t kLeastMovement = 256;

}  // namespace

void RunWatch::Started(pid_t rsync) {
    rsync_ = rsync;
}

RunWatch::Fault RunWatch::Look(bool begun) {
    const Clock::time_point now = Clock::now();
    if (rsync_ < 0 || now < next_look_) {
        return Fault::NONE;
    }
    next_look_ = now + kLookEvery;
    const LinkState before = link_;
    link_ = link_watch_.Look(rsync_);
    if (link_.connected && !before.connected) {
        connected_ = now;
    }
    if (link_.bytes_sent >= before.bytes_sent + kLeastMovement ||
        link_.bytes_received >= before.bytes_received + kLeastMovement) {
        moved_ = now;
    }
    if (link_.unanswered >= patience_.dead) {
        return Fault::DEAD;
    }
    const Clock::time_point waits_since =
        link_.connected ? connected_ : started_ + patience_.connect;
    if (begun || patience_.begin == std::chrono::seconds(0) ||
        now < waits_since + patience_.begin) {
        return Fault::NONE;
    }
    return link_.connected && link_.bytes_received == 0 ? Fault::SILENT : Fault::NOT_BEGUN;
}

unsigned int RunWatch::SecondsStill() const {
    const auto still = std::chrono::duration_cast<std::chrono::seconds>(Clock::now() - moved_);
    return static_cast<unsigned int>(still.count());
}

}  // namespace Backup
}  // namespace TARQ

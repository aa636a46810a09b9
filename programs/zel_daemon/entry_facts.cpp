#include "programs/zel_daemon/entry_facts.h"

#include <fcntl.h>

#include <ctime>

namespace zel_daemon {

namespace {

constexpr int64_t kSecond = 1000000000;
// Times come from a clock that ticks at least 100 times a second; some file systems keep them in
// steps of 10 ms or of whole seconds, two at most.
constexpr int64_t kTick = 50000000;
constexpr int64_t kCoarseStep = 10000000;
constexpr int64_t kCoarseTick = 2 * kSecond + kTick;
constexpr int64_t kLongAgo = 10;  // seconds

uint64_t Nanoseconds(const statx_timestamp& time) {
    return static_cast<uint64_t>(time.tv_sec) * uint64_t{kSecond} + time.tv_nsec;
}

bool IsYoung(const statx_timestamp& changed, const LookTime& look) {
    if (changed.tv_sec < look.seconds - kLongAgo) {
        return false;
    }
    if (changed.tv_sec > look.seconds) {  // a clock was set back: later changes may meet it
        return true;
    }
    const int64_t age =
        (look.seconds - changed.tv_sec) * kSecond + look.nanoseconds - changed.tv_nsec;
    return age < (changed.tv_nsec % kCoarseStep == 0 ? kCoarseTick : kTick);
}

}  // namespace

bool IsUnchanged(const EntryFacts& known, const EntryFacts& now) {
    // A folder's size says nothing that its times do not.
    return !known.young && known.mode == now.mode && known.inode == now.inode &&
           (known.size == now.size || known.IsFolder()) && known.modified == now.modified &&
           known.changed == now.changed;
}

LookTime::LookTime() {
    timespec now = {};
    clock_gettime(CLOCK_REALTIME, &now);
    seconds = now.tv_sec;
    nanoseconds = now.tv_nsec;
}

std::optional<EntryFacts> FactsOf(int folder, const char* name, const LookTime& look) {
    struct statx info = {};
    if (statx(folder, name, AT_SYMLINK_NOFOLLOW | AT_EMPTY_PATH | AT_NO_AUTOMOUNT,
              STATX_BASIC_STATS, &info) != 0) {
        return std::nullopt;
    }
    EntryFacts facts;
    facts.mode = info.stx_mode;
    facts.inode = info.stx_ino;
    facts.size = info.stx_size;
    facts.modified = Nanoseconds(info.stx_mtime);
    facts.changed = Nanoseconds(info.stx_ctime);
    facts.linked = info.stx_nlink > 1 && !facts.IsFolder();
    facts.young = IsYoung(info.stx_ctime, look);
    return facts;
}

}  // namespace zel_daemon

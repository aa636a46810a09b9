// What plain and TLS channels have in common: waiting for the socket, logging transfers, closing.
//
// Descriptors of any number: the waits are made with poll(2), whose answers are read as select(2)
// would report them (its three sets are named "read", "write" and "exception").
#pragma once

#include <sched.h>
#include <sys/time.h>

#include <algorithm>
#include <chrono>
#include <cstdint>

#include "ZEL/channel.h"

namespace ZEL {

/// The operations of a plain channel, whose handle is a PlainSocket.
extern const ChannelOps kPlainOps;
/// The operations of a TLS channel, whose handle is an SSL that owns its context.
extern const ChannelOps kTlsOps;

/// True when the caller has asked, through the flag (may be null), for waits to be given up.
inline bool Aborted(const int* flag) {
    // Another thread sets the int while this one waits.
    return flag != nullptr && __atomic_load_n(flag, __ATOMIC_RELAXED) != 0;
}

/// Adaptive polling before a read blocks. A peer that answers at once then costs neither a sleep
/// nor a wake-up, which take many times longer than a short answer. After each attempt in vain,
/// twice as many of the following reads block at once.
class Patience {
public:
    /// Calls `came` repeatedly, yielding the processor in between, until it returns true, the time
    /// for polling is over or the flag (may be null) is set. Does nothing while polling is skipped.
    template <typename Came>
    void LookForAMoment(const int* flag, Came came) {
        if (to_skip_ > 0) {
            --to_skip_;
            return;
        }
        const auto end = std::chrono::steady_clock::now() + kMoment;
        bool found = false;
        do {
            sched_yield();
            found = came();
        } while (!found && !Aborted(flag) && std::chrono::steady_clock::now() < end);
        skipped_ = found ? 0 : std::min(2 * skipped_ + 1, kMostSkipped);
        to_skip_ = skipped_;
    }

private:
    // Somewhat longer than it takes to wake a sleeping thread.
    static constexpr std::chrono::microseconds kMoment{100};
    static constexpr unsigned int kMostSkipped = 255;
    unsigned int skipped_ = 0;  // after the last look in vain
    unsigned int to_skip_ = 0;
};

/// The handle of a plain channel, on the heap.
struct PlainSocket {
    int fd;
    /// Whether its peer can send urgent data, which a wait has to see before anything is moved.
    bool can_be_urgent;
    Patience patience = {};
};

/// The handle of a descriptor, which becomes the channel's.
PlainSocket* NewPlainSocket(int fd);

enum class Watch { kRead, kWrite };

/// What a wait saw.
struct Readiness {
    bool ready = false;      ///< the watched direction would not block
    bool exception = false;  ///< the peer has sent urgent data
};

/// A channel's waits are made of such intervals.
constexpr timeval kSlice = {1, 0};

/// A wait in the milliseconds that poll(2) takes, rounded up; at least 0.
int PollMilliseconds(int64_t seconds, int64_t microseconds);

/// Waits for one interval, after polling with `patience` (may be null). 0: something is in
/// `readiness`; -1: the flag is set; -9: nothing happened; -3.
int WaitFd(int fd, Watch watch, const timeval& interval, const int* flag, Patience* patience,
           Readiness& readiness);

/// The wait in front of a read or write: 0 when the direction is ready, else a result code.
int WaitReadable(int fd, const timeval& interval, const int* flag, Patience* patience);
/// `urgent_text`: what a write's log line says of urgent data; the two modes say it differently.
int WaitWritable(int fd, const timeval& interval, const int* flag, const char* urgent_text);

/// A read of 0 bytes is refused: -4, otherwise 0.
int RefuseEmptyRead(unsigned int length);

/// Log `count` bytes as read or written and return it.
int TellRead(int count);
int TellWritten(int count);

/// Shuts down both directions and closes.
void CloseSocket(int fd);

}  // namespace ZEL

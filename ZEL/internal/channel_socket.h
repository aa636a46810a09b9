// What a channel's plain mode and its TLS mode do alike with the socket below them: wait for it,
// tell what was moved, close it.
//
// Descriptors of any number: the waits are made with poll(2), whose answers are read as select(2)
// would report them (its three sets are named "read", "write" and "exception").
#pragma once

#include <sys/time.h>

#include "ZEL/channel.h"

namespace ZEL {

/// The operations of a TLS channel, whose handle is an SSL that owns its context.
extern const ChannelOps kTlsOps;

/// The handle of a plain channel, on the heap.
struct PlainSocket {
    int fd;
    /// Whether its peer can send urgent data, which a wait has to see before anything is written.
    bool can_be_urgent;
};

enum class Watch { kRead, kWrite };

/// What a wait saw.
struct Readiness {
    bool ready = false;      ///< the watched direction would not block
    bool exception = false;  ///< the peer has sent urgent data
};

/// A wait of `interval` in the milliseconds that poll(2) takes, rounded up; at least 0.
int PollMilliseconds(const timeval& interval);

/// True when the caller has asked, through the flag (may be null), for waits to be given up.
bool Aborted(const int* flag);

/// Waits for one interval. 0: something is in `readiness`; -1: the flag is set; -9: nothing
/// happened; -3.
int WaitFd(int fd, Watch watch, const timeval& interval, const int* flag, Readiness& readiness);

/// The wait in front of a read or write: 0 when the direction is ready, else a result code.
int WaitReadable(int fd, const timeval& interval, const int* flag);
int WaitWritable(int fd, const timeval& interval, const int* flag);

/// A read of 0 bytes is refused: -4, otherwise 0.
int RefuseEmptyRead(unsigned int length);

/// Log `count` bytes as read or written and return it.
int TellRead(int count);
int TellWritten(int count);

/// Shuts down both directions and closes.
void CloseSocket(int fd);

}  // namespace ZEL

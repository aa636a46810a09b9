#include "platform/tarqrsync/helpers/relay.h"

#include <fcntl.h>
#include <poll.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <memory>
#include <optional>
#include <string>

namespace tarqrsync {

namespace {

using Result = TlsConnection::Result;
using std::chrono::milliseconds;
using std::chrono::seconds;
using std::chrono::steady_clock;

constexpr size_t kBufferSize = size_t{256} * 1024;
constexpr milliseconds kLastWords(1000);
// How often it is looked whether the other program is gone, once it has said its last.
constexpr milliseconds kLookEvery(100);
// rsync's own limit on silence comes first, where it still keeps one: it says more.
constexpr seconds kAfterRsyncsOwn(2);

[[noreturn]] void Fail(const char* what) {
    throw ConnectError(std::string("cannot ") + what + " rsync: " + strerror(errno));
}

bool WouldBlock() {
    return errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR;
}

/// Bytes on their way in one direction.
class Buffer {
public:
    bool IsEmpty() const { return begin_ == end_; }
    char* Room() { return bytes_.get(); }  // of an empty one
    static constexpr size_t kRoom = kBufferSize;
    void Filled(size_t count) {
        begin_ = 0;
        end_ = count;
    }
    const char* Left() const { return bytes_.get() + begin_; }
    size_t Size() const { return end_ - begin_; }
    void Taken(size_t count) { begin_ += count; }

private:
    std::unique_ptr<char[]> bytes_{new char[kBufferSize]};  // not filled with zeros first
    size_t begin_ = 0;
    size_t end_ = 0;
};

/// How far the direction to the server is.
enum class Flow { kOpen, kEnding /* nothing more comes; it is to be said */, kClosed };

class Relayed {
public:
    Relayed(TlsConnection& server, seconds silence)
        : server_(server), silence_(silence), parent_(getppid()) {
        setsid();
        prctl(PR_SET_PDEATHSIG, 0);
        server_.SetNonBlocking();
        for (const int fd : {STDIN_FILENO, STDOUT_FILENO}) {
            fcntl(fd, F_SETFL, fcntl(fd, F_GETFL) | O_NONBLOCK);
        }
    }

    void Run() {
        // A daemon ends when all is said. rsync keeps its end open until this program is gone.
        while (!server_ended_) {
            // What was read from one is written to the other at once: mostly it can be.
            const bool moved_up = MoveUp();
            const bool moved_down = MoveDown();
            if (moved_up || moved_down) {
                still_since_.reset();
            } else if (!Wait()) {
                return;
            }
        }
    }

private:
    // Each moves what it can without waiting, and tells whether that was anything.

    bool MoveUp() {
        bool moved = false;
        up_waits_ = 0;
        if (up_ == Flow::kOpen && to_server_.IsEmpty()) {
            moved = ReadFromRsync();
        }
        if (!to_server_.IsEmpty()) {
            size_t count = 0;
            switch (server_.Write(to_server_.Left(), to_server_.Size(), count)) {
                case Result::kDone:
                    to_server_.Taken(count);
                    return true;
                case Result::kWantsRead:
                    up_waits_ = POLLIN;
                    break;
                default:
                    up_waits_ = POLLOUT;
            }
        } else if (up_ == Flow::kEnding) {
            if (server_.CloseHalf() == Result::kDone) {
                shutdown(server_.Fd(), SHUT_WR);
                up_ = Flow::kClosed;
                return true;
            }
            up_waits_ = POLLOUT;
        }
        return moved;
    }

    bool ReadFromRsync() {
        const ssize_t count = read(STDIN_FILENO, to_server_.Room(), Buffer::kRoom);
        if (count < 0 && WouldBlock()) {
            return false;
        }
        if (count < 0) {
            Fail("read from");
        }
        if (count == 0) {
            up_ = Flow::kEnding;
            return true;
        }
        to_server_.Filled(static_cast<size_t>(count));
        return true;
    }

    bool MoveDown() {
        bool moved = false;
        down_waits_ = 0;
        if (to_rsync_.IsEmpty()) {
            size_t count = 0;
            switch (server_.Read(to_rsync_.Room(), Buffer::kRoom, count)) {
                case Result::kDone:
                    to_rsync_.Filled(count);
                    moved = true;
                    break;
                case Result::kEnd:
                    server_ended_ = true;
                    return true;
                case Result::kWantsRead:
                    down_waits_ = POLLIN;
                    break;
                case Result::kWantsWrite:
                    down_waits_ = POLLOUT;
                    break;
            }
        }
        if (!to_rsync_.IsEmpty()) {
            const ssize_t count = write(STDOUT_FILENO, to_rsync_.Left(), to_rsync_.Size());
            if (count < 0 && !WouldBlock()) {
                Fail("write to");
            }
            to_rsync_.Taken(count < 0 ? 0 : static_cast<size_t>(count));
            moved = moved || count > 0;
        }
        return moved;
    }

    // False when there is nobody left to work for.
    bool Wait() {
        std::array<pollfd, 3> fds = {};
        fds[0] = {up_ == Flow::kOpen && to_server_.IsEmpty() ? STDIN_FILENO : -1, POLLIN, 0};
        fds[1] = {!to_rsync_.IsEmpty() ? STDOUT_FILENO : -1, POLLOUT, 0};
        const int waits = up_waits_ | down_waits_;
        fds[2] = {waits != 0 ? server_.Fd() : -1, static_cast<short>(waits), 0};
        // As long as rsync may still write, its end is read from that; otherwise it is looked for.
        const bool look = up_ != Flow::kOpen || !to_server_.IsEmpty();
        const auto now = steady_clock::now();
        if (look && getppid() != parent_) {
            give_up_ = give_up_.value_or(now + kLastWords);
            // Nobody reads what the server may still say.
            if (up_ == Flow::kClosed || now >= *give_up_) {
                return false;
            }
        }
        still_since_ = still_since_.value_or(now);
        if (silence_ != seconds(0) && now >= *still_since_ + silence_ + kAfterRsyncsOwn) {
            throw ConnectError("nothing has moved for " + std::to_string(silence_.count()) + " s");
        }
        const milliseconds wait = look                     ? kLookEvery
                                  : silence_ != seconds(0) ? kAfterRsyncsOwn
                                                           : milliseconds(-1);
        poll(fds.data(), fds.size(), static_cast<int>(wait.count()));
        return true;
    }

    TlsConnection& server_;
    const seconds silence_;
    const pid_t parent_;
    Buffer to_server_;
    Buffer to_rsync_;
    Flow up_ = Flow::kOpen;
    bool server_ended_ = false;
    int up_waits_ = 0;  // for what of the server's socket
    int down_waits_ = 0;
    std::optional<steady_clock::time_point> still_since_;
    std::optional<steady_clock::time_point> give_up_;
};

}  // namespace

void Relay(TlsConnection& server, seconds silence) {
    Relayed(server, silence).Run();
}

}  // namespace tarqrsync

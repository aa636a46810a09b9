#include "ZEL/channel.h"

#include <arpa/inet.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <typeinfo>

#include "ZEL/internal/channel_socket.h"
#include "ZEL/log.h"
#include "base/unique_fd.h"

namespace ZEL {

static_assert(__BYTE_ORDER__ == __ORDER_LITTLE_ENDIAN__, "Convert() makes wire order by reversing");

namespace {

using base::UniqueFd;

using std::chrono::steady_clock;

constexpr int kLingerSeconds = 1;
// Each second of waiting counts as this many while connecting. A server that is up answers at once,
// and several addresses may have to be tried within one time-out.
constexpr unsigned int kConnectSecondsPerSlice = 3;

// A block of at least this many bytes is received straight into the caller's buffer, which saves a
// copy. For smaller ones, reading ahead into the ring saves more.
constexpr unsigned int kLargeRead = 16384;

const char* ResultText(int code) {
    // Fixed texts, indexed by the negated code.
    static const char* const texts[] = {
        "Successful",
        "Interrupted",
        "I/O error",
        "System error",
        "Invalid argument",
        "Protocal error",
        "Authentication failure",
        "Server error",
        "Event conflict",
        "Connection timeout",
        "Incompatible version",
        "No such entry",
        "Invalid username",
        "Password and username not matched",
        "NXO disabled",
        "User quota not enough",
        "Disk is full",
        "Sync Folder is miss",
        "View missing/invalid",
        "no permission ",
        "pull event by path, but the path is missing",
        "connection about by setting flag",
        "Local Disk is full",
        "file locked or no permission",
        "ssl certificate verify fail",
        "permission is read-only",
    };
    return code < RESULT_READ_ONLY || code > 0 ? "Unknown error" : texts[-code];
}

// The system's limit for SO_SNDBUF in bytes; 0 when it cannot be read.
int LargestSendBuffer() {
    static const int largest = [] {
        const UniqueFd file(open("/proc/sys/net/core/wmem_max", O_RDONLY | O_CLOEXEC));
        char text[32] = "";
        const ssize_t count = file ? read(file.Get(), text, sizeof text - 1) : 0;
        return count > 0 ? atoi(text) : 0;
    }();
    return largest;
}

// Sets socket options so that sender and receiver do not wait for each other. Failures are ignored.
void TuneForThroughput(int fd, unsigned int capacity) {
    // Writes are already batched in the ring, so a message's last small packet must not wait for
    // the acknowledgement of earlier ones. Sockets other than TCP have no such delay and refuse the
    // option.
    const int on = 1;
    if (setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on) == 0) {
        return;
    }
    // A unix socket is writable while at most a quarter of its send buffer is used. That quarter
    // should hold two full rings. The kernel limits the requested size and then doubles it. A
    // buffer that is already larger stays as it is.
    const int wanted =
        static_cast<int>(std::min<int64_t>(int64_t{capacity} * 4, LargestSendBuffer()));
    int present = 0;
    socklen_t size = sizeof present;
    if (getsockopt(fd, SOL_SOCKET, SO_SNDBUF, &present, &size) == 0 && present / 2 < wanted) {
        setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &wanted, sizeof wanted);
    }
}

}  // namespace

Channel::Channel(unsigned int capacity)
    // Counts of bytes are passed on as int.
    : capacity_(std::min(capacity, static_cast<unsigned int>(INT_MAX))) {
    write_.bytes.reset(new char[capacity_]);
    read_.bytes.reset(new char[capacity_]);
    Channel::SwitchChannelOp(1);
}

Channel::~Channel() {
    Channel::Close();
}

int Channel::Open(const char* path) {
    if (path == nullptr) {
        return RESULT_INVALID_ARGUMENT;
    }
    UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Channel: Can not open socket. %s\n", __LINE__,
                       strerror(errno));
        return RESULT_SYSTEM;
    }
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    memcpy(address.sun_path, path, strnlen(path, sizeof address.sun_path - 1));
    if (connect(fd.Get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): Channel: Can not connect to server at '%s'. %s\n", __LINE__,
            path, strerror(errno));
        return RESULT_IO;
    }
    if (SetNonBlock(fd.Get()) != 0) {
        return RESULT_SYSTEM;
    }
    TuneForThroughput(fd.Get(), capacity_);
    AdoptSocket(fd.Get());
    fd.Release();
    return RESULT_SUCCESS;
}

int Channel::Open(int fd, bool setup) {
    if (!IsClosed()) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Open: Channel already opened [%d]\n", __LINE__,
                       ops_.get_fd(handle_));
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): Open: %s\n", __LINE__,
                       ResultText(RESULT_INVALID_ARGUMENT));
        return RESULT_INVALID_ARGUMENT;
    }
    if (setup && SetLinger(fd, kLingerSeconds) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Open: SetLinger to socket [%d] failed, %s\n",
                       __LINE__, fd, strerror(errno));
        return RESULT_SYSTEM;
    }
    if (setup && SetNonBlock(fd) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Open: SetNonBlock to socket [%d] failed, %s\n",
                       __LINE__, fd, strerror(errno));
        return RESULT_SYSTEM;
    }
    if (fd < 0) {
        return RESULT_INVALID_ARGUMENT;
    }
    if (setup) {
        TuneForThroughput(fd, capacity_);
    }
    AdoptSocket(fd);
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): Channel: opening socket %d\n",
                   __LINE__, fd);
    return RESULT_SUCCESS;
}

int Channel::Open(const char* ip, int port) {
    if (ip == nullptr || port < 0) {
        return RESULT_SUCCESS;
    }
    UniqueFd fd(CreateSock());
    if (!fd) {
        return RESULT_IO;
    }
    if (SetLinger(fd.Get(), kLingerSeconds) != 0 || SetNonBlock(fd.Get()) != 0) {
        return RESULT_SYSTEM;
    }
    TuneForThroughput(fd.Get(), capacity_);
    if (ConnectWithTimeout(fd.Get(), ip, port) != 0) {
        return RESULT_IO;
    }
    AdoptSocket(fd.Get());
    fd.Release();
    return RESULT_SUCCESS;
}

// Also called by the destructor, when a derived class's overrides are no longer in effect.
// NOLINTBEGIN(clang-analyzer-optin.cplusplus.VirtualCall)
void Channel::Close() {
    if (!IsClosed()) {
        const int result = FlushWrite(0);
        if (result < 0) {
            Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): FlushWrite: %s\n",
                           __LINE__, ResultText(result));
            ClearRead();
            ClearWrite();
        }
    }
    Adopt(nullptr);
}
// NOLINTEND(clang-analyzer-optin.cplusplus.VirtualCall)

void Channel::SetTimeout(unsigned int seconds) {
    timeout_ = seconds;
}

void Channel::SetFlag(int* flag) {
    abort_flag_ = flag;
}

int Channel::ReadByte(unsigned char* value) {
    return Read(reinterpret_cast<char*>(value), sizeof *value);
}

int Channel::ReadInt16(unsigned short* value) {
    return ReadInteger(value);
}

int Channel::ReadInt32(unsigned int* value) {
    return ReadInteger(value);
}

int Channel::ReadInt64(unsigned long long* value) {
    return ReadInteger(value);
}

int Channel::WriteByte(unsigned char value) {
    return Write(reinterpret_cast<const char*>(&value), sizeof value);
}

int Channel::WriteInt16(unsigned short value) {
    return WriteInteger(value);
}

int Channel::WriteInt32(unsigned int value) {
    return WriteInteger(value);
}

int Channel::WriteInt64(unsigned long long value) {
    return WriteInteger(value);
}

int Channel::Read(char* buffer, unsigned int want) {
    unsigned int total = 0;
    return Read(buffer, want, total);
}

int Channel::Read(char* buffer, unsigned int want, unsigned int& total) {
    total = 0;
    if (IsClosed()) {
        return RESULT_IO;
    }
    if ((buffer == nullptr || capacity_ == 0) && want > 0) {
        return RESULT_INVALID_ARGUMENT;
    }
    total = std::min(want, read_.size);
    CopyOut(buffer, total);
    int result = RESULT_SUCCESS;
    while (result == 0 && total < want) {
        unsigned int chunk = std::min(want - total, capacity_);
        Logger::LogMsg(
            Logger::LEVEL_DEBUG,
            "[DEBUG] ZEL/channel(%d): want = %zu, len = %zu, total = %zu, capacity = %zu\n",
            __LINE__, size_t{want}, size_t{chunk}, size_t{total}, size_t{capacity_});
        if (chunk >= kLargeRead && shortcuts_ && !Logger::Passes(Logger::LEVEL_DEBUG)) {
            // Past the ring, which is empty here.
            int arrived = 0;
            result = Receive(static_cast<int>(chunk), buffer + total, arrived);
            total += static_cast<unsigned int>(arrived);
            continue;
        }
        result = ReadMore(static_cast<int>(chunk));
        chunk =
            std::min(chunk, read_.size);  // fewer after a failure: what did arrive is handed out
        CopyOut(buffer + total, chunk);
        total += chunk;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG,
                   "[DEBUG] ZEL/channel(%d): Read: read %zu bytes, head = %zu, size = %zu\n",
                   __LINE__, size_t{total}, size_t{read_.head}, size_t{read_.size});
    return result;
}

int Channel::Write(const char* data, unsigned int length) {
    if (IsClosed()) {
        return RESULT_IO;
    }
    if (length > capacity_) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Write: Exceed maximum data block size\n",
                       __LINE__);
        return RESULT_INVALID_ARGUMENT;
    }
    if (data == nullptr && length > 0) {
        return RESULT_INVALID_ARGUMENT;
    }
    if (length > capacity_ - write_.size) {
        const int result = FlushWrite(static_cast<int>(length - (capacity_ - write_.size)));
        if (result < 0) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] ZEL/channel(%d): Write: FlushWrite failed\n", __LINE__);
            return result;
        }
    }
    if (length > 0) {
        unsigned int tail = write_.head + write_.size;
        tail = tail < capacity_ ? tail : tail - capacity_;
        const unsigned int first = std::min(length, capacity_ - tail);
        memcpy(write_.bytes.get() + tail, data, first);
        memcpy(write_.bytes.get(), data + first, length - first);
        write_.size += length;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): Write: write %zu bytes\n",
                   __LINE__, size_t{length});
    return RESULT_SUCCESS;
}

void Channel::ClearRead() {
    read_.head = read_.size = 0;
}

void Channel::ClearWrite() {
    write_.head = write_.size = 0;
}

int Channel::FlushWrite(int count) {
    const unsigned int wanted =
        count == 0 ? write_.size : static_cast<unsigned int>(std::max(count, 0));
    steady_clock::time_point last_progress = steady_clock::now();
    for (unsigned int sent = 0; sent < wanted;) {
        if (Aborted(abort_flag_)) {
            return RESULT_INTERRUPTED;
        }
        const unsigned int chunk = std::min(write_.size, capacity_ - write_.head);
        Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): WriteFd: from %zu, len %zu\n",
                       __LINE__, size_t{write_.head}, size_t{chunk});
        const int moved =
            ops_.write(handle_, write_.bytes.get() + write_.head, chunk, kSlice, abort_flag_);
        if (moved == RESULT_TIMEOUT) {
            if (TimedOut(last_progress)) {
                Logger::LogMsg(
                    Logger::LEVEL_WARNING,
                    "[WARNING] ZEL/channel(%d): FlushWrite: Channel timeout for %u seconds\n",
                    __LINE__, timeout_);
                return moved;
            }
        } else if (moved < 0) {
            return moved;
        } else {
            const auto bytes = static_cast<unsigned int>(moved);
            sent += bytes;
            write_.size -= bytes;
            write_.head += bytes;
            if (write_.head == capacity_ || write_.size == 0) {
                write_.head = 0;
            }
            if (sent < wanted) {
                last_progress = steady_clock::now();
            }
        }
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG,
                   "[DEBUG] ZEL/channel(%d): FlushWrite: flush at least %d bytes\n", __LINE__,
                   static_cast<int>(wanted));
    return RESULT_SUCCESS;
}

int Channel::GetPeerInfo(std::string& ip, int& port) const {
    ip.clear();
    if (IsClosed()) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): GetPeerInfo: Attempting to get info of an "
                       "uninitialized channel\n",
                       __LINE__);
        return RESULT_INTERRUPTED;
    }
    sockaddr_storage peer = {};
    socklen_t size = sizeof peer;
    if (getpeername(ops_.get_fd(handle_), reinterpret_cast<sockaddr*>(&peer), &size) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): GetPeerInfo: getpeername: %s\n", __LINE__,
                       strerror(errno));
        return RESULT_INTERRUPTED;
    }
    // Other families than IPv4 are passed on as one that inet_ntop() refuses.
    const int family = peer.ss_family == AF_INET ? AF_INET : AF_UNSPEC;
    const auto* address = reinterpret_cast<const sockaddr_in*>(&peer);
    char text[INET_ADDRSTRLEN] = "";
    if (inet_ntop(family, &address->sin_addr, text, sizeof text) == nullptr) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): GetPeerInfo: inet_ntop: %s (%d)\n", __LINE__,
                       strerror(errno), errno);
        return RESULT_INTERRUPTED;
    }
    ip = text;
    port = ntohs(address->sin_port);
    return RESULT_SUCCESS;
}

bool Channel::IsClosed() const {
    return ops_.is_closed(handle_);
}

int Channel::ReadMore(int want) {
    int total = 0;
    return Receive(want, nullptr, total);
}

unsigned long long Channel::Convert(unsigned long long value) {
    return __builtin_bswap64(value);
}

unsigned int Channel::Convert(unsigned int value) {
    return __builtin_bswap32(value);
}

unsigned short Channel::Convert(unsigned short value) {
    return __builtin_bswap16(value);
}

int Channel::CreateSock() {
    return socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
}

int Channel::SetLinger(int fd, int seconds) {
    const linger value = {1, seconds};
    if (setsockopt(fd, SOL_SOCKET, SO_LINGER, &value, sizeof value) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): setsockopt: %s\n",
                       __LINE__, strerror(errno));
        return -1;
    }
    return 0;
}

int Channel::SetNonBlock(int fd) {
    const int flags = fcntl(fd, F_GETFL);
    if (flags >= 0 && (flags & O_NONBLOCK) != 0) {
        return 0;
    }
    if (flags < 0 || fcntl(fd, F_SETFL, flags | O_NONBLOCK) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): fcntl: %s\n", __LINE__,
                       strerror(errno));
        return -1;
    }
    return 0;
}

int Channel::ConnectWithTimeout(int fd, const char* ip, int port) {
    if (fd == -1 || ip == nullptr || port < 0 || port > USHRT_MAX) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Invalid argumants (ip: %s, port: %d\n", __LINE__,
                       ip == nullptr ? "(null)" : ip, port);
        return RESULT_INVALID_ARGUMENT;
    }
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_addr.s_addr = inet_addr(ip);
    address.sin_port = htons(static_cast<uint16_t>(port));
    if (connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) {
        return RESULT_SUCCESS;
    }
    if (errno != EINPROGRESS) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): connect: %s (%d)\n",
                       __LINE__, strerror(errno), errno);
        return RESULT_SYSTEM;
    }
    uint64_t elapsed = 0;
    for (;;) {
        Readiness readiness;
        const int result = WaitFd(fd, Watch::kWrite, kSlice, abort_flag_, nullptr, readiness);
        if (result == 0 && readiness.exception) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] ZEL/channel(%d): connect: exception set\n", __LINE__);
            return RESULT_IO;
        }
        if (result == 0 && !readiness.ready) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] ZEL/channel(%d): connect: write fd is not set\n", __LINE__);
            return RESULT_SYSTEM;
        }
        if (result != RESULT_TIMEOUT) {
            return result;
        }
        elapsed += kConnectSecondsPerSlice;
        if (timeout_ != 0 && elapsed >= timeout_) {
            Logger::LogMsg(
                Logger::LEVEL_WARNING,
                "[WARNING] ZEL/channel(%d): Channel timed out during connect (%d seconds), "
                "abort anyway\n",
                __LINE__, static_cast<int>(timeout_));
            return RESULT_TIMEOUT;
        }
    }
}

void Channel::SwitchChannelOp(int plain) {
    ops_ = plain == 1 ? kPlainOps : kTlsOps;
}

// Closes the current connection and continues in plain mode with `handle`.
void Channel::Adopt(void* handle) {
    if (handle_ != nullptr) {
        ops_.close(handle_);
    }
    handle_ = handle;
    tls_ = false;
    shortcuts_ = handle != nullptr && typeid(*this) == typeid(Channel);
    SwitchChannelOp(1);  // NOLINT(clang-analyzer-optin.cplusplus.VirtualCall): see Close()
}

void Channel::AdoptSocket(int fd) {
    Adopt(NewPlainSocket(fd));
    ClearRead();
    ClearWrite();
}

// Receives at least `want` bytes into the read ring; or, when `target` is not null, exactly so many
// to there. `total`: how many came.
int Channel::Receive(int want, char* target, int& total) {
    total = 0;
    if (want < 1) {
        return RESULT_SUCCESS;
    }
    steady_clock::time_point last_progress = steady_clock::now();
    while (total < want) {
        if (Aborted(abort_flag_)) {
            return RESULT_INTERRUPTED;
        }
        const unsigned int tail = read_.head + read_.size;
        const unsigned int start = tail < capacity_ ? tail : tail - capacity_;
        const unsigned int room = target != nullptr  ? static_cast<unsigned int>(want - total)
                                  : tail < capacity_ ? capacity_ - tail
                                                     : capacity_ - read_.size;
        char* const place = target != nullptr ? target + total : read_.bytes.get() + start;
        Logger::LogMsg(
            Logger::LEVEL_DEBUG,
            "[DEBUG] ZEL/channel(%d): ReadMore: want = %d, total = %d, len = %zu, r_head = "
            "%zu, r_size = %zu\n",
            __LINE__, want, total, size_t{room}, size_t{read_.head}, size_t{read_.size});
        const int moved = ops_.read(handle_, place, room, kSlice, abort_flag_);
        if (moved == RESULT_TIMEOUT) {
            if (TimedOut(last_progress)) {
                Logger::LogMsg(
                    Logger::LEVEL_DEBUG,
                    "[DEBUG] ZEL/channel(%d): ReadMore: Channel timeout for %u seconed\n", __LINE__,
                    timeout_);
                return moved;
            }
        } else if (moved < 0) {
            return moved;
        } else {
            read_.size += target == nullptr ? static_cast<unsigned int>(moved) : 0;
            total += moved;
            if (total < want) {
                last_progress = steady_clock::now();
            }
        }
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG,
                   "[DEBUG] ZEL/channel(%d): ReadMore: read at least %d bytes\n", __LINE__, want);
    return RESULT_SUCCESS;
}

// Moves bytes that the read ring holds to `buffer`.
void Channel::CopyOut(char* buffer, unsigned int count) {
    if (count == 0) {
        return;
    }
    const unsigned int first = std::min(count, capacity_ - read_.head);
    memcpy(buffer, read_.bytes.get() + read_.head, first);
    memcpy(buffer + first, read_.bytes.get(), count - first);
    Took(count);
}

bool Channel::TimedOut(steady_clock::time_point last_progress) const {
    return timeout_ != 0 && steady_clock::now() - last_progress >= std::chrono::seconds(timeout_);
}

template <typename T>
int Channel::ReadInteger(T* value) {
    T wire = 0;
    const int result =
        Read(value == nullptr ? nullptr : reinterpret_cast<char*>(&wire), sizeof wire);
    if (result == 0 && value != nullptr) {
        *value = Convert(wire);
    }
    return result;
}

template <typename T>
int Channel::WriteInteger(T value) {
    const T wire = Convert(value);
    return Write(reinterpret_cast<const char*>(&wire), sizeof wire);
}

}  // namespace ZEL

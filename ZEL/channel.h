// A buffered stream socket with time-outs, plain or TLS, and the result codes of all that is built
// on it.
#pragma once

#include <string.h>
#include <sys/time.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <string>

#include "ZEL/log.h"

struct ssl_st;      // OpenSSL's SSL
struct ssl_ctx_st;  // OpenSSL's SSL_CTX

namespace ZEL {

#pragma GCC visibility push(default)

class PStream;

/// What the transport, encoding and IPC operations return: 0 or a positive count for success, else
/// one of these. They are passed up unchanged. The codes that no operation of this library returns
/// belong to the service's programs.
enum ResultCode : int {
    RESULT_SUCCESS = 0,
    RESULT_INTERRUPTED = -1,       ///< the abort flag was set; a set-up failed; closed channel
    RESULT_IO = -2,                ///< the connection broke or ended in the middle of a value
    RESULT_SYSTEM = -3,            ///< a call of the system or of the TLS library failed
    RESULT_INVALID_ARGUMENT = -4,  ///< a null buffer, too large a block, an unusable address
    RESULT_PROTOCOL = -5,          ///< the peer sent bytes that are not a value
    RESULT_AUTHENTICATION = -6,
    RESULT_SERVER = -7,
    RESULT_EVENT_CONFLICT = -8,
    RESULT_TIMEOUT = -9,  ///< nothing moved for the time-out
    RESULT_VERSION = -10,
    RESULT_NO_ENTRY = -11,
    RESULT_INVALID_USER = -12,
    RESULT_WRONG_PASSWORD = -13,
    RESULT_DISABLED = -14,
    RESULT_QUOTA = -15,
    RESULT_DISK_FULL = -16,
    RESULT_FOLDER_MISSING = -17,
    RESULT_INVALID_VIEW = -18,
    RESULT_NO_PERMISSION = -19,
    RESULT_EVENT_PATH_MISSING = -20,
    RESULT_ABORTED_BY_FLAG = -21,
    RESULT_LOCAL_DISK_FULL = -22,
    RESULT_FILE_LOCKED = -23,
    RESULT_CERTIFICATE = -24,  ///< the peer's TLS certificate failed verification
    RESULT_READ_ONLY = -25
};

/// The operations of one mode of a channel. `read` and `write` wait for one interval at most and
/// return a count above 0 or a result code; `flag` is the abort flag.
struct ChannelOps {
    int (*read)(void* handle, char* buffer, unsigned int length, const timeval& interval,
                const int* flag);
    int (*write)(void* handle, const char* data, unsigned int length, const timeval& interval,
                 const int* flag);
    int (*get_fd)(void* handle);  ///< the socket; -1 when closed
    void (*close)(void* handle);  ///< closes the socket and frees the handle
    bool (*is_closed)(void* handle);
};

/// A connection: to an IPv4 address, to a unix domain socket, or over a descriptor that is open
/// already.
///
/// Writes are gathered in a ring and sent when it is full or FlushWrite() asks for it; reads are
/// served from a second ring. Each wait is made of slices of one second, between which the abort
/// flag is looked at. A peer that goes away never raises SIGPIPE.
///
/// Urgent data on a TCP connection is an error at the next transfer: our peers never send any. On a
/// unix socket it is noticed only when a transfer has to wait: checking before each transfer would
/// cost as much as the transfer itself, and kernels support urgent data there only since 5.15.
///
/// A read polls for up to 100 microseconds, yielding the processor, before it blocks: a peer that
/// answers at once then costs no sleep and wake-up. As long as polling is in vain, it is skipped
/// for up to 255 reads in a row.
///
/// Results are 0 or a ResultCode unless said otherwise. After a failure only Close() is useful.
///
/// Threads: a channel belongs to one thread at a time. Another thread may set the int that the
/// abort flag points to (an atomic store keeps race detectors quiet).
class Channel {
public:
    /// `capacity`: bytes of each ring, and the largest block that one Write() takes. Above INT_MAX
    /// it is INT_MAX.
    explicit Channel(unsigned int capacity);
    Channel(const Channel&) = delete;
    Channel& operator=(const Channel&) = delete;

    /// Closes.
    virtual ~Channel();

    // The order of the virtual operations is part of the binary interface.

    /// Connects to a unix domain socket; `path` is cut to 107 bytes. -3: no socket; -2: no
    /// connection.
    virtual int Open(const char* path);
    /// Takes over a connected socket: it is the channel's from a result of 0 on, and the caller's
    /// otherwise. `setup`: lets close() linger for 1 s and makes the socket non-blocking. -4: the
    /// channel is open, or fd is no descriptor; -3: setup failed.
    virtual int Open(int fd, bool setup);
    /// Connects to a dotted IPv4 address; an open connection is replaced. -2: no connection; -3:
    /// setup failed. A null address or a negative port opens nothing and gives 0: look at
    /// IsClosed(). The wait ends with the peer's first answer, even a refusal, which shows as -2 at
    /// the first transfer.
    virtual int Open(const char* ip, int port);
    /// Sends what the write ring holds, as long as that makes progress, ends TLS and closes the
    /// socket. The channel can be opened again.
    virtual void Close();

    /// The longest time without progress, in seconds; 0: no limit. 60 unless set.
    virtual void SetTimeout(unsigned int seconds);
    /// When the int is not 0, every wait gives up with -1. Null (the default): no flag. The int is
    /// the caller's and must outlive its use here.
    virtual void SetFlag(int* flag);

    /// Turns the open connection into a TLS one, as the server or as the client; on a TLS channel
    /// it does nothing. All plain bytes of both directions must have been flushed and read before:
    /// the rings stay as they are.
    ///
    /// A client with SetAllowUntrust(false) accepts only a certificate that GetCAPath() vouches for
    /// and, when a host name is set, only one of that name. The abort flag is not looked at during
    /// the handshake. -2: set-up or handshake failed; -9: no message of the handshake was
    /// completed for the time-out; -24: the certificate. The channel then is open and plain, and
    /// the handshake's bytes are lost: close it.
    virtual int ConvertToSSLChannel(bool server);

    // Read and write integers, most significant byte first. What Read() and Write() return.
    virtual int ReadByte(unsigned char* value);
    virtual int ReadInt16(unsigned short* value);
    virtual int ReadInt32(unsigned int* value);
    virtual int ReadInt64(unsigned long long* value);
    virtual int WriteByte(unsigned char value);
    virtual int WriteInt16(unsigned short value);
    virtual int WriteInt32(unsigned int value);
    virtual int WriteInt64(unsigned long long value);

    /// Reads exactly `want` bytes.
    virtual int Read(char* buffer, unsigned int want);
    /// The same; `total` is the number of bytes that were stored, also when it failed.
    virtual int Read(char* buffer, unsigned int want, unsigned int& total);
    /// Puts a block into the write ring, sending older bytes when there is no room. -4, and nothing
    /// written, for a block larger than the ring. Nothing else is sent before FlushWrite().
    virtual int Write(const char* data, unsigned int length);
    /// Discard what was read ahead, or written and not yet sent.
    virtual void ClearRead();
    virtual void ClearWrite();
    /// Sends at least `count` bytes of the write ring; 0: all that it holds.
    virtual int FlushWrite(int count);

    /// The peer's IPv4 address and port. 0, or -1 with `ip` emptied: closed, or not an IPv4
    /// connection.
    virtual int GetPeerInfo(std::string& ip, int& port) const;
    virtual bool IsClosed() const;

    // The steps of the operations above.

    /// Receives at least `want` more bytes into the read ring, whatever it holds.
    virtual int ReadMore(int want);
    /// Reverse the byte order: the host is little-endian, the wire big-endian.
    virtual unsigned long long Convert(unsigned long long value);
    virtual unsigned int Convert(unsigned int value);
    virtual unsigned short Convert(unsigned short value);
    /// A new IPv4 stream socket, or -1.
    virtual int CreateSock();
    /// Lets close() wait so many seconds for unsent bytes. 0 or -1.
    virtual int SetLinger(int fd, int seconds);
    /// 0 or -1.
    virtual int SetNonBlock(int fd);
    /// Connects a non-blocking socket. Three seconds are counted for each one-second slice of
    /// waiting, so that it gives up after a third of the time-out.
    virtual int ConnectWithTimeout(int fd, const char* ip, int port);
    /// 1: the operations of the plain mode; any other value: those of TLS. Only while the channel
    /// is closed, or with a handle of that mode.
    virtual void SwitchChannelOp(int plain);

    /// The name that the server's certificate must carry; empty (the default): any name.
    void SetSSLHostname(const std::string& name) { tls_host_name_ = name; }
    /// Whether a client accepts a server that fails verification. True unless set.
    void SetAllowUntrust(bool allow) { allow_untrusted_ = allow; }
    bool IsAllowingUntrust() const { return allow_untrusted_; }

    // The TLS files of the process: the server's certificate chain and private key (PEM), and the
    // CA certificates that a client trusts. Any thread may call; a conversion uses what is set when
    // it starts. Certificate and key at the default paths must belong to root or the caller:
    // anybody may make files there. Better set paths of your own.
    static std::string GetCertPath();  ///< "/tmp/.cloud_certs" unless set
    static void SetCERTPath(const std::string& path);
    static std::string GetKeyPath();  ///< "/tmp/.cloud_server.key" unless set
    static void SetPriKeyPath(const std::string& path);
    static std::string GetCAPath();  ///< "/certs.pem" unless set
    static void SetVerifyCAPath(const std::string& path);

    // The steps of ConvertToSSLChannel(). 0 or -1, with the reason in the log.

    /// Makes context and TLS object of one connection; free both with DeinitSSL(). Both null after
    /// a failure.
    static int InitSSL(ssl_st*& ssl, ssl_ctx_st*& ctx, bool server, bool allow_untrusted);
    static int InstallCERT(ssl_ctx_st* ctx);
    static int InstallPriKey(ssl_ctx_st* ctx);
    static int InstallVerifyCA(ssl_ctx_st* ctx);
    /// Ends TLS and frees both (null is allowed), which become null. `quiet`: the peer is told
    /// nothing.
    static void DeinitSSL(ssl_st*& ssl, ssl_ctx_st*& ctx, bool quiet);
    /// Moves what this thread's OpenSSL error queue holds to the log.
    static void log_ssl();

private:
    friend class PStream;  // moves most of a message by the shortcuts below

    struct Ring {
        std::unique_ptr<char[]> bytes;
        unsigned int head = 0;  // where the first byte held lies
        unsigned int size = 0;  // bytes held, from head on, round the end
    };

    // Fast paths of Write() and Read() for a few bytes that are contiguous in the ring, as they
    // nearly always are. Otherwise, and while tracing is on, they do nothing, and the caller uses
    // the operation itself.
    bool CanStore(size_t count) const;
    bool Store(const void* data, size_t count);
    bool Fetch(void* buffer, size_t count);
    // The next `count` bytes to read, still in the ring, or null.
    const char* Ahead(size_t count) const;
    void Took(size_t count);

    void Adopt(void* handle);
    void AdoptSocket(int fd);
    int Receive(int want, char* target, int& total);
    void CopyOut(char* buffer, unsigned int count);
    bool TimedOut(std::chrono::steady_clock::time_point last_progress) const;
    template <typename T>
    int ReadInteger(T* value);
    template <typename T>
    int WriteInteger(T value);

    void* handle_ = nullptr;  // plain: a PlainSocket; TLS: the TLS object; null: closed
    ChannelOps ops_ = {};     // of the current mode
    Ring write_;
    Ring read_;
    unsigned int capacity_;      // bytes of each ring
    unsigned int timeout_ = 60;  // seconds; 0: no limit
    int* abort_flag_ = nullptr;  // not owned
    bool tls_ = false;
    bool allow_untrusted_ = true;
    std::string tls_host_name_;
    bool shortcuts_ = false;  // open, and not of a derived class, which may override operations
};

inline bool Channel::CanStore(size_t count) const {
    const size_t tail = size_t{write_.head} + write_.size;
    return shortcuts_ && !Logger::Passes(Logger::LEVEL_DEBUG) && tail <= capacity_ &&
           count <= capacity_ - tail;
}

inline bool Channel::Store(const void* data, size_t count) {
    if (!CanStore(count)) {
        return false;
    }
    memcpy(write_.bytes.get() + write_.head + write_.size, data, count);
    write_.size += static_cast<unsigned int>(count);
    return true;
}

inline const char* Channel::Ahead(size_t count) const {
    const size_t held = std::min(read_.size, capacity_ - read_.head);
    return shortcuts_ && !Logger::Passes(Logger::LEVEL_DEBUG) && count <= held
               ? read_.bytes.get() + read_.head
               : nullptr;
}

inline bool Channel::Fetch(void* buffer, size_t count) {
    const char* bytes = Ahead(count);
    if (bytes == nullptr) {
        return false;
    }
    memcpy(buffer, bytes, count);
    Took(count);
    return true;
}

inline void Channel::Took(size_t count) {
    read_.size -= static_cast<unsigned int>(count);
    const size_t head = read_.head + count;
    // An empty ring starts again at its beginning, so that the next receive has all the room in one
    // piece.
    read_.head = static_cast<unsigned int>(read_.size == 0    ? 0
                                           : head < capacity_ ? head
                                                              : head - capacity_);
}

#pragma GCC visibility pop

}  // namespace ZEL

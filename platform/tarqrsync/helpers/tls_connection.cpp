#include "platform/tarqrsync/helpers/tls_connection.h"

#include <fcntl.h>
#include <netdb.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/err.h>
#include <sys/socket.h>
#include <sys/time.h>

#include <cerrno>
#include <cstring>

#include "base/key_fingerprint.h"

namespace tarqrsync {

namespace {

// An idle connection is probed, so that a server that is gone is found: as the wrapper has it with
// connections of rsync's own.
constexpr int kProbeAfterSeconds = 10;
constexpr int kProbeEverySeconds = 10;
constexpr int kProbes = 15;

// OpenSSL reads so much of what has come at once, instead of a record's head and then its rest.
constexpr size_t kReadAhead = size_t{64} * 1024;

struct AddressesFree {
    void operator()(addrinfo* list) const { freeaddrinfo(list); }
};

void SetOptions(int fd) {
    const int on = 1;
    setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    setsockopt(fd, IPPROTO_TCP, TCP_KEEPIDLE, &kProbeAfterSeconds, sizeof(int));
    setsockopt(fd, IPPROTO_TCP, TCP_KEEPINTVL, &kProbeEverySeconds, sizeof(int));
    setsockopt(fd, IPPROTO_TCP, TCP_KEEPCNT, &kProbes, sizeof(int));
    setsockopt(fd, SOL_SOCKET, SO_KEEPALIVE, &on, sizeof on);
}

base::UniqueFd Connect(const addrinfo& address, time_t seconds) {
    base::UniqueFd fd(socket(address.ai_family, SOCK_STREAM | SOCK_CLOEXEC, 0));
    timeval patience = {};
    patience.tv_sec = seconds;
    if (fd) {
        setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    }
    if (!fd || connect(fd.Get(), address.ai_addr, address.ai_addrlen) != 0) {
        if (errno == EINPROGRESS) {
            errno = ETIMEDOUT;
        }
        return {};
    }
    patience = {};
    setsockopt(fd.Get(), SOL_SOCKET, SO_SNDTIMEO, &patience, sizeof patience);
    SetOptions(fd.Get());
    return fd;
}

base::UniqueFd ConnectToAny(const char* host, const char* port, int seconds) {
    addrinfo hints = {};
    hints.ai_socktype = SOCK_STREAM;
    hints.ai_flags = AI_NUMERICSERV;
    addrinfo* list = nullptr;
    const int failed = getaddrinfo(host, port, &hints, &list);
    const std::unique_ptr<addrinfo, AddressesFree> owner(list);
    if (failed != 0) {
        throw ConnectError("cannot find " + std::string(host) + ": " + gai_strerror(failed));
    }
    int count = 0;
    for (const addrinfo* address = list; address != nullptr; address = address->ai_next) {
        ++count;
    }
    for (const addrinfo* address = list; address != nullptr; address = address->ai_next) {
        base::UniqueFd fd = Connect(*address, seconds / count + 1);
        if (fd) {
            return fd;
        }
    }
    throw ConnectError("cannot connect: " + std::string(strerror(errno)));
}

// What OpenSSL says of the last failure, or the system where OpenSSL says nothing.
std::string Reason(int system_error) {
    const unsigned long error = ERR_peek_last_error();
    const char* const text = error == 0 ? nullptr : ERR_reason_error_string(error);
    return text != nullptr     ? text
           : system_error != 0 ? strerror(system_error)
                               : "the server closed the connection";
}

}  // namespace

TlsConnection::TlsConnection(const char* host, const char* port, int seconds)
    : socket_(ConnectToAny(host, port, seconds)), context_(SSL_CTX_new(TLS_client_method())) {
    if (context_ && SSL_CTX_set_min_proto_version(context_.get(), TLS1_3_VERSION) == 1) {
        // The caller checks the key, which is all that counts.
        SSL_CTX_set_verify(context_.get(), SSL_VERIFY_NONE, nullptr);
        SSL_CTX_set_mode(context_.get(),
                         SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
        SSL_CTX_set_read_ahead(context_.get(), 1);
        SSL_CTX_set_default_read_buffer_len(context_.get(), kReadAhead);
        ssl_.reset(SSL_new(context_.get()));
    }
    if (!ssl_ || SSL_set_fd(ssl_.get(), socket_.Get()) != 1) {
        throw ConnectError("no TLS: " + Reason(0));
    }
    ERR_clear_error();
    errno = 0;
    if (SSL_connect(ssl_.get()) != 1) {
        throw ConnectError("no TLS: " + Reason(errno));
    }
}

std::string TlsConnection::KeyFingerprint() const {
    const std::unique_ptr<X509, decltype(&X509_free)> certificate(
        SSL_get_peer_certificate(ssl_.get()), X509_free);
    const auto fingerprint = base::KeyFingerprint(certificate.get());
    if (!fingerprint) {
        throw ConnectError("no TLS: the server shows no key");
    }
    return *fingerprint;
}

void TlsConnection::SetNonBlocking() {
    fcntl(socket_.Get(), F_SETFL, O_NONBLOCK);
}

TlsConnection::Result TlsConnection::ResultOf(int returned, const char* what) const {
    switch (SSL_get_error(ssl_.get(), returned)) {
        case SSL_ERROR_WANT_READ:
            return Result::kWantsRead;
        case SSL_ERROR_WANT_WRITE:
            return Result::kWantsWrite;
        default:
            throw ConnectError(std::string("connection lost while ") + what + ": " + Reason(errno));
    }
}

TlsConnection::Result TlsConnection::Read(char* bytes, size_t size, size_t& count) {
    ERR_clear_error();
    errno = 0;
    const int done = SSL_read_ex(ssl_.get(), bytes, size, &count);
    // The same is said of a write that fails behind the server's end: there it is a failure.
    if (done != 1 && SSL_get_error(ssl_.get(), done) == SSL_ERROR_ZERO_RETURN) {
        return Result::kEnd;
    }
    return done == 1 ? Result::kDone : ResultOf(done, "reading");
}

TlsConnection::Result TlsConnection::Write(const char* bytes, size_t size, size_t& count) {
    ERR_clear_error();
    errno = 0;
    const int done = SSL_write_ex(ssl_.get(), bytes, size, &count);
    return done == 1 ? Result::kDone : ResultOf(done, "writing");
}

TlsConnection::Result TlsConnection::CloseHalf() {
    ERR_clear_error();
    errno = 0;
    const int done = SSL_shutdown(ssl_.get());
    return done >= 0 ? Result::kDone : ResultOf(done, "closing");
}

}  // namespace tarqrsync

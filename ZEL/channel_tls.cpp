// The TLS mode of a channel.
//
// OpenSSL is used through its 1.1 interface. Its per-thread error queue is emptied before each call
// whose result is looked at with SSL_get_error(), which would otherwise report another connection's
// old error.
#include <errno.h>
#include <openssl/err.h>
#include <openssl/ssl.h>
#include <openssl/x509v3.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <memory>
#include <mutex>
#include <utility>

#include "ZEL/channel.h"
#include "ZEL/internal/cert_name.h"
#include "ZEL/internal/channel_socket.h"
#include "ZEL/internal/tls_socket_bio.h"
#include "ZEL/log.h"
#include "tarq/root_path.h"

namespace ZEL {

namespace {

using std::chrono::steady_clock;

constexpr char kClientCiphers[] = "RC4-MD5";

template <auto function>
struct Deleter {
    template <typename T>
    void operator()(T* object) const {
        function(object);
    }
};
using OwnedX509 = std::unique_ptr<X509, Deleter<X509_free>>;
using OwnedNames = std::unique_ptr<GENERAL_NAMES, Deleter<GENERAL_NAMES_free>>;

// A process-wide path: until it is set, the default below the current root folder.
class PathSetting {
public:
    explicit PathSetting(const char* default_path) : default_path_(default_path) {}

    std::string Get() {
        const std::lock_guard<std::mutex> lock(mutex_);
        return set_ ? path_ : TARQ::RootPath(default_path_);
    }

    void Set(const std::string& path) {
        const std::lock_guard<std::mutex> lock(mutex_);
        path_ = path;
        set_ = true;
    }

    /// The file, safe to use: the default lies in a folder where anybody may have been first, so
    /// there it must be root's or the caller's own. Empty otherwise.
    std::string GetOwn() {
        const std::lock_guard<std::mutex> lock(mutex_);
        if (set_) {
            return path_;
        }
        const std::string path = TARQ::RootPath(default_path_);
        struct stat info {};
        const bool own =
            lstat(path.c_str(), &info) == 0 && (info.st_uid == 0 || info.st_uid == geteuid());
        return own ? path : "";
    }

private:
    const char* default_path_;
    std::mutex mutex_;
    std::string path_;
    bool set_ = false;
};

PathSetting& CertSetting() {
    static PathSetting setting("/tmp/.cloud_certs");
    return setting;
}

PathSetting& KeySetting() {
    static PathSetting setting("/tmp/.cloud_server.key");
    return setting;
}

PathSetting& CaSetting() {
    static PathSetting setting("/certs.pem");
    return setting;
}

// A daemon has no terminal to ask for a passphrase: encrypted keys are refused.
int RefusePassphrase(char*, int, int, void*) {
    return 0;
}

bool NewContext(SSL_CTX*& ctx, const SSL_METHOD* method) {
    SSL_CTX_free(ctx);
    ctx = SSL_CTX_new(method);
    if (ctx == nullptr) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): m_ssl_ctx created failed\n", __LINE__);
        return false;
    }
    // A retried write may come from another place in the ring, and each record that was sent counts
    // as progress.
    SSL_CTX_set_mode(ctx, SSL_MODE_ENABLE_PARTIAL_WRITE | SSL_MODE_ACCEPT_MOVING_WRITE_BUFFER);
    // Renegotiation by the peer would make writes wait for reads.
    SSL_CTX_set_options(ctx, SSL_OP_NO_RENEGOTIATION);
    // Reads several records with one system call.
    SSL_CTX_set_read_ahead(ctx, 1);
    SSL_CTX_set_default_read_buffer_len(ctx, size_t{4} * SSL3_RT_MAX_PACKET_SIZE);
    SSL_CTX_set_default_passwd_cb(ctx, RefusePassphrase);
    return true;
}

bool NewTlsObject(SSL*& ssl, SSL_CTX* ctx) {
    ssl = SSL_new(ctx);
    if (ssl == nullptr) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): m_ssl created failed\n",
                       __LINE__);
    }
    return ssl != nullptr;
}

bool SetUpServer(SSL*& ssl, SSL_CTX*& ctx) {
    if (!NewContext(ctx, TLS_server_method())) {
        return false;
    }
    if (Channel::InstallCERT(ctx) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Open: init ssl certificate failed\n", __LINE__);
        return false;
    }
    // A key of another type than the certificate's loads without an error; only the check finds it.
    if (Channel::InstallPriKey(ctx) != 0 || SSL_CTX_check_private_key(ctx) != 1) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Open: init ssl private key failed\n", __LINE__);
        return false;
    }
    // Each connection has its own context, so sessions are never resumed and tickets are useless.
    // An unread ticket would also turn the close of a client that only sends into a reset.
    SSL_CTX_set_num_tickets(ctx, 0);
    if (!NewTlsObject(ssl, ctx)) {
        return false;
    }
    SSL_set_accept_state(ssl);
    return true;
}

bool SetUpClient(SSL*& ssl, SSL_CTX*& ctx, bool allow_untrusted) {
    if (!NewContext(ctx, TLS_client_method())) {
        return false;
    }
    if (SSL_CTX_set_cipher_list(ctx, kClientCiphers) != 1) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): can't set cipher suit to SSL3_TXT_RSA_RC4_128_MD5\n",
            __LINE__);
        // The refused list has already replaced the default ciphers of TLS 1.2 and below: start
        // over.
        if (!NewContext(ctx, TLS_client_method())) {
            return false;
        }
    }
    if (!NewTlsObject(ssl, ctx)) {
        return false;
    }
    if (!allow_untrusted && Channel::InstallVerifyCA(ctx) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): InitSSL(): set Verify store fail\n", __LINE__);
        return false;
    }
    // The chain is verified anyway; the result is checked after the handshake.
    SSL_set_verify(ssl, SSL_VERIFY_NONE, nullptr);
    SSL_set_connect_state(ssl);
    return true;
}

bool WantsRetry(int error) {
    return error == SSL_ERROR_WANT_READ || error == SSL_ERROR_WANT_WRITE;
}

// After a fatal error nothing may be sent any more, so the later shutdown must be a quiet one.
void ForbidAlerts(SSL* ssl, int error) {
    if (error == SSL_ERROR_SSL || error == SSL_ERROR_SYSCALL) {
        SSL_set_quiet_shutdown(ssl, 1);
    }
}

int WaitForHandshake(SSL* ssl, Watch watch, const timeval& interval) {
    Readiness readiness;
    const int result = WaitFd(SSL_get_fd(ssl), watch, interval, nullptr, nullptr, readiness);
    if (result < 0) {
        return result;
    }
    if (readiness.exception) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): SSLHandshake: exception set\n", __LINE__);
        return RESULT_IO;
    }
    if (!readiness.ready) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): SSLHandshake: select returns but fd is not set\n",
            __LINE__);
        return RESULT_SYSTEM;
    }
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): SSLHandshake: reset timeout\n",
                   __LINE__);
    return RESULT_SUCCESS;
}

// Only a complete handshake message counts as progress, and there are few of them. Single bytes do
// not: a peer could send one at a time and hold the caller for as long as it likes.
int SSLHandshake(SSL* ssl, const timeval& interval, unsigned int timeout) {
    auto last_progress = steady_clock::now();
    OSSL_HANDSHAKE_STATE state = SSL_get_state(ssl);
    for (;;) {
        ERR_clear_error();
        const int step = SSL_do_handshake(ssl);
        if (step == 1) {
            return RESULT_SUCCESS;
        }
        if (SSL_get_state(ssl) != state) {
            state = SSL_get_state(ssl);
            last_progress = steady_clock::now();
        }
        const int error = SSL_get_error(ssl, step);
        if (step == 0) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] ZEL/channel(%d): SSLHandshake: SSL error code: %d\n",
                           __LINE__, error);
            Channel::log_ssl();
            return RESULT_IO;
        }
        if (!WantsRetry(error)) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] ZEL/channel(%d): SSLHandshake: SSL fatel error code: %d\n",
                           __LINE__, error);
            Channel::log_ssl();
            return RESULT_IO;
        }
        const int result = WaitForHandshake(
            ssl, error == SSL_ERROR_WANT_READ ? Watch::kRead : Watch::kWrite, interval);
        if (result != RESULT_SUCCESS && result != RESULT_TIMEOUT) {
            return result;
        }
        if (timeout != 0 && steady_clock::now() - last_progress >= std::chrono::seconds(timeout)) {
            Logger::LogMsg(Logger::LEVEL_WARNING,
                           "[WARNING] ZEL/channel(%d): SSLHandshake: timed out during connect (%d "
                           "seconds), abort anyway\n",
                           __LINE__, static_cast<int>(timeout));
            return RESULT_TIMEOUT;
        }
    }
}

bool Covers(const ASN1_STRING* name, const std::string& host) {
    unsigned char* bytes = nullptr;
    const int length = ASN1_STRING_to_UTF8(&bytes, name);
    if (length < 0) {
        return false;
    }
    const std::unique_ptr<unsigned char, void (*)(unsigned char*)> owner(
        bytes, [](unsigned char* text) { OPENSSL_free(text); });
    return CertNameCovers(std::string(reinterpret_cast<char*>(bytes), static_cast<size_t>(length)),
                          host);
}

bool CommonNameCovers(X509* certificate, const std::string& host) {
    const X509_NAME* subject = X509_get_subject_name(certificate);
    const int index = X509_NAME_get_index_by_NID(subject, NID_commonName, -1);
    return index >= 0 &&
           Covers(X509_NAME_ENTRY_get_data(X509_NAME_get_entry(subject, index)), host);
}

bool AlternativeNameCovers(X509* certificate, const std::string& host) {
    const OwnedNames names(static_cast<GENERAL_NAMES*>(
        X509_get_ext_d2i(certificate, NID_subject_alt_name, nullptr, nullptr)));
    for (int i = 0; i < sk_GENERAL_NAME_num(names.get()); ++i) {
        const GENERAL_NAME* name = sk_GENERAL_NAME_value(names.get(), i);
        if (name->type == GEN_DNS && Covers(name->d.dNSName, host)) {
            return true;
        }
    }
    return false;
}

bool PeerIsTrusted(SSL* ssl, const std::string& host) {
    if (SSL_get_verify_result(ssl) != X509_V_OK) {
        return false;
    }
    if (host.empty()) {
        return true;
    }
    const OwnedX509 certificate(SSL_get_peer_certificate(ssl));
    return certificate != nullptr && (CommonNameCovers(certificate.get(), host) ||
                                      AlternativeNameCovers(certificate.get(), host));
}

// Owns what ConvertToSSLChannel() has set up until the channel takes it over.
class PendingTls {
public:
    PendingTls() = default;
    ~PendingTls() { Channel::DeinitSSL(ssl, ctx, true); }
    PendingTls(const PendingTls&) = delete;
    PendingTls& operator=(const PendingTls&) = delete;

    SSL* ssl = nullptr;
    SSL_CTX* ctx = nullptr;
};

int TlsSocket(void* handle) {
    return handle == nullptr ? -1 : SSL_get_fd(static_cast<SSL*>(handle));
}

// The result code of a read that returned no bytes.
int ReadFailure(SSL* ssl, int count) {
    const int error = SSL_get_error(ssl, count);
    if (WantsRetry(error)) {
        // The record is incomplete, or it carried no data.
        Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): SSL want read", __LINE__);
        return RESULT_TIMEOUT;
    }
    ForbidAlerts(ssl, error);
    Channel::log_ssl();
    return RESULT_IO;
}

// Like SSL_read(), but reads all full records that are available. A failure after the first one
// shows again at the next call.
int ReadRecords(SSL* ssl, char* buffer, int length) {
    ERR_clear_error();
    int total = 0;
    int count = 0;
    do {
        count = SSL_read(ssl, buffer + total, length - total);
        total += std::max(count, 0);
    } while (count == SSL3_RT_MAX_PLAIN_LENGTH && total < length);
    return total > 0 ? total : count;
}

int SSLReadFd(void* handle, char* buffer, unsigned int length, const timeval& interval,
              const int* flag) {
    auto* ssl = static_cast<SSL*>(handle);
    int result = RefuseEmptyRead(length);
    if (result < 0) {
        return result;
    }
    const bool decrypted = ssl != nullptr && SSL_pending(ssl) > 0;
    // Bytes that were read ahead may hold a complete record, which waiting for the socket would
    // miss.
    bool look = ssl != nullptr && SSL_has_pending(ssl) != 0;
    int count = 0;
    do {
        if (!look) {
            Patience* const patience = ssl == nullptr ? nullptr : &PatienceOf(SSL_get_rbio(ssl));
            result = WaitReadable(TlsSocket(handle), interval, flag, patience);
            if (result < 0) {
                return result;
            }
        }
        count = ReadRecords(ssl, buffer, static_cast<int>(length));
        if (count > 0) {
            return TellRead(count);
        }
    } while (!decrypted && std::exchange(look, false) && WantsRetry(SSL_get_error(ssl, count)));
    if (decrypted) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Diagnose: SSL_read failed\n", __LINE__);
        ForbidAlerts(ssl, SSL_get_error(ssl, count));
        Channel::log_ssl();
        return RESULT_IO;
    }
    return ReadFailure(ssl, count);
}

int SSLWriteFd(void* handle, const char* data, unsigned int length, const timeval& interval,
               const int* flag) {
    auto* ssl = static_cast<SSL*>(handle);
    const int result = WaitWritable(TlsSocket(handle), interval, flag, "exception set");
    if (result < 0) {
        return result;
    }
    ERR_clear_error();
    errno = 0;
    // Writes as many records as the socket takes after one wait. A failure after the first one
    // shows again at the next call.
    int total = 0;
    int count = 0;
    do {
        count = SSL_write(ssl, data + total, static_cast<int>(length) - total);
        total += std::max(count, 0);
    } while (count > 0 && total < static_cast<int>(length));
    const int saved_errno = errno;
    if (total > 0) {
        return TellWritten(total);
    }
    const int error = SSL_get_error(ssl, count);
    ForbidAlerts(ssl, error);
    if (WantsRetry(error)) {
        Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): SSL want write\n", __LINE__);
        return RESULT_TIMEOUT;
    }
    if (error == SSL_ERROR_SYSCALL) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): syscall error: n = %d, ssl_ret = %d, errno = %d, err "
            "= %s\n",
            __LINE__, count, error, saved_errno, strerror(saved_errno));
        return RESULT_SYSTEM;
    }
    Logger::LogMsg(Logger::LEVEL_WARNING,
                   "[WARNING] ZEL/channel(%d): misc error: n = %d, ssl_ret = %d, errno = %d\n",
                   __LINE__, count, error, saved_errno);
    return RESULT_IO;
}

void CloseTls(void* handle) {
    auto* ssl = static_cast<SSL*>(handle);
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): destroy ssl obj %p\n", __LINE__,
                   handle);
    const int fd = TlsSocket(handle);
    SSL_CTX* ctx = SSL_get_SSL_CTX(ssl);
    Channel::DeinitSSL(ssl, ctx, false);
    CloseSocket(fd);
}

bool IsTlsClosed(void* handle) {
    return handle == nullptr;
}

}  // namespace

const ChannelOps kTlsOps = {SSLReadFd, SSLWriteFd, TlsSocket, CloseTls, IsTlsClosed};

int Channel::ConvertToSSLChannel(bool server) {
    if (tls_) {
        Logger::LogMsg(
            Logger::LEVEL_WARNING,
            "[WARNING] ZEL/channel(%d): ConvertToSSLChannel: Channel is SSL channel, no need "
            "to be converted\n",
            __LINE__);
        return RESULT_SUCCESS;
    }
    PendingTls tls;
    if (InitSSL(tls.ssl, tls.ctx, server, allow_untrusted_) != 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): Open: init ssl failed\n",
                       __LINE__);
        return RESULT_IO;
    }
    BIO* bio = NewTlsSocketBio(ops_.get_fd(handle_));
    if (bio == nullptr) {
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): set fd failed\n",
                       __LINE__);
        return RESULT_IO;
    }
    SSL_set_bio(tls.ssl, bio, bio);
    const int result = SSLHandshake(tls.ssl, kSlice, timeout_);
    if (result < 0) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Open to SSL connect to server failed\n",
                       __LINE__);
        return result == RESULT_TIMEOUT ? result : RESULT_IO;
    }
    if (!server && !allow_untrusted_ && !PeerIsTrusted(tls.ssl, tls_host_name_)) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): ConvertToSSLChannel: Verify Fail!\n", __LINE__);
        return RESULT_CERTIFICATE;
    }
    delete static_cast<PlainSocket*>(handle_);  // the record only: the socket lives on below TLS
    handle_ = tls.ssl;
    tls_ = true;
    SwitchChannelOp(0);
    tls.ssl = nullptr;
    tls.ctx = nullptr;
    return RESULT_SUCCESS;
}

std::string Channel::GetCertPath() {
    return CertSetting().Get();
}

void Channel::SetCERTPath(const std::string& path) {
    CertSetting().Set(path);
}

std::string Channel::GetKeyPath() {
    return KeySetting().Get();
}

void Channel::SetPriKeyPath(const std::string& path) {
    KeySetting().Set(path);
}

std::string Channel::GetCAPath() {
    return CaSetting().Get();
}

void Channel::SetVerifyCAPath(const std::string& path) {
    CaSetting().Set(path);
}

int Channel::InitSSL(SSL*& ssl, SSL_CTX*& ctx, bool server, bool allow_untrusted) {
    ssl = nullptr;
    ctx = nullptr;
    if (server ? SetUpServer(ssl, ctx) : SetUpClient(ssl, ctx, allow_untrusted)) {
        return 0;
    }
    DeinitSSL(ssl, ctx, true);
    return -1;
}

int Channel::InstallCERT(SSL_CTX* ctx) {
    const std::string path = GetCertPath();
    Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/channel(%d): cert path = %s\n", __LINE__,
                   path.c_str());
    if (SSL_CTX_use_certificate_chain_file(ctx, CertSetting().GetOwn().c_str()) != 1) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Install certificate failed\n", __LINE__);
        return -1;
    }
    return 0;
}

int Channel::InstallPriKey(SSL_CTX* ctx) {
    if (SSL_CTX_use_PrivateKey_file(ctx, KeySetting().GetOwn().c_str(), SSL_FILETYPE_PEM) != 1) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): Install private key failed\n", __LINE__);
        return -1;
    }
    return 0;
}

int Channel::InstallVerifyCA(SSL_CTX* ctx) {
    const std::string path = GetCAPath();
    if (SSL_CTX_load_verify_locations(ctx, path.c_str(), nullptr) != 1) {
        Logger::LogMsg(Logger::LEVEL_WARNING,
                       "[WARNING] ZEL/channel(%d): SSL_CTX_load_verify_locations(%s) failed\n",
                       __LINE__, path.c_str());
        return -1;
    }
    return 0;
}

void Channel::DeinitSSL(SSL*& ssl, SSL_CTX*& ctx, bool quiet) {
    if (ssl != nullptr) {
        if (quiet) {
            SSL_set_quiet_shutdown(ssl, 1);
        }
        // Sends our close notification without waiting for the peer's: the socket is closed next.
        SSL_shutdown(ssl);
        SSL_free(ssl);
    }
    SSL_CTX_free(ctx);
    ssl = nullptr;
    ctx = nullptr;
    ERR_clear_error();
}

void Channel::log_ssl() {
    while (const unsigned long error = ERR_get_error()) {
        char text[256];
        ERR_error_string_n(error, text, sizeof text);
        Logger::LogMsg(Logger::LEVEL_WARNING, "[WARNING] ZEL/channel(%d): ssl-errors: %s\n",
                       __LINE__, text);
    }
}

}  // namespace ZEL

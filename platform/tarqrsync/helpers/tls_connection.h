#pragma once

#include <openssl/ssl.h>

#include <cstddef>
#include <memory>
#include <stdexcept>
#include <string>

#include "base/unique_fd.h"

namespace tarqrsync {

/// what() is a line for people, of which platform/tarqrsync/explain.cpp makes a sentence.
class ConnectError : public std::runtime_error {
public:
    using std::runtime_error::runtime_error;
};

/// A TLS 1.3 connection to a server that is known by its public key alone: neither its
/// certificate's name nor its dates nor who signed it count, and nothing is sent but the handshake
/// before the caller has looked at KeyFingerprint().
class TlsConnection {
public:
    /// Connects, in about `seconds` at most, however many addresses the host has, and shakes hands,
    /// for which it waits as long as it takes. Throws ConnectError.
    TlsConnection(const char* host, const char* port, int seconds);

    /// "SHA256:..." of the public key that the server has proved to have.
    std::string KeyFingerprint() const;

    enum class Result { kDone, kWantsRead, kWantsWrite, kEnd };

    /// Once SetNonBlocking() was called. `count`: what was read or written with kDone. kEnd: the
    /// server has closed its half. Throw ConnectError.
    Result Read(char* bytes, size_t size, size_t& count);
    Result Write(const char* bytes, size_t size, size_t& count);
    /// Closes this half. kDone or kWantsWrite.
    Result CloseHalf();

    void SetNonBlocking();
    int Fd() const { return socket_.Get(); }

private:
    struct Free {
        void operator()(SSL_CTX* context) const { SSL_CTX_free(context); }
        void operator()(SSL* ssl) const { SSL_free(ssl); }
    };

    Result ResultOf(int returned, const char* what) const;

    base::UniqueFd socket_;
    std::unique_ptr<SSL_CTX, Free> context_;
    std::unique_ptr<SSL, Free> ssl_;
};

}  // namespace tarqrsync

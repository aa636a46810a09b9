// Blocks of 64 KiB from one thread to another, a flush after each.
//
// The bare TLS peer is a loop of SSL_write and SSL_read over blocking sockets, with the cipher that
// the two ends agree on by default, as a channel's do.
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>

#include <cstdio>
#include <cstdlib>
#include <functional>
#include <thread>

#include "ZEL/channel.h"
#include "bench/messages/contests.h"

namespace bench {

namespace {

using ZEL::Channel;

constexpr unsigned int kBlock = 65536;
constexpr int kBlocks = 4000;  // a round

// Megabytes a second from `put` to `take`, which each move one block.
double Throughput(const std::function<void(const char*)>& put,
                  const std::function<void(char*)>& take) {
    const std::string source(kBlock, 'x');
    std::string target(kBlock, ' ');
    const double seconds = Seconds([&] {
        std::thread far([&] {
            for (int i = 0; i < kBlocks; ++i) {
                take(target.data());
            }
        });
        for (int i = 0; i < kBlocks; ++i) {
            put(source.data());
        }
        far.join();
    });
    Require(source == target, "the comparison of the last block");
    return double{kBlock} * kBlocks / seconds / 1e6;
}

// Runs `far` on a thread of its own beside `near`.
void Both(const std::function<void()>& near, const std::function<void()>& far) {
    std::thread other(far);
    near();
    other.join();
}

struct Channels {
    Channels() {
        const Connection connection;
        Require(near.Open(connection.fds[0], true) == 0, "open");
        Require(far.Open(connection.fds[1], true) == 0, "open");
    }
    Channel near{kCapacity};
    Channel far{kCapacity};
};

double ChannelThroughput(Channels& ends) {
    return Throughput(
        [&](const char* block) {
            Require(ends.near.Write(block, kBlock) == 0 && ends.near.FlushWrite(0) == 0, "write");
        },
        [&](char* block) { Require(ends.far.Read(block, kBlock) == 0, "read"); });
}

// A self-signed certificate and its key, in files of a folder that goes with the object.
class Certificate {
public:
    Certificate() {
        Require(mkdtemp(folder_) != nullptr, "mkdtemp");
        EVP_PKEY* key = EVP_RSA_gen(2048);
        X509* certificate = X509_new();
        X509_gmtime_adj(X509_getm_notBefore(certificate), 0);
        X509_gmtime_adj(X509_getm_notAfter(certificate), 86400);
        X509_set_pubkey(certificate, key);
        Require(X509_sign(certificate, key, EVP_sha256()) > 0, "X509_sign");
        FILE* file = fopen(CertificatePath().c_str(), "w");
        Require(file != nullptr && PEM_write_X509(file, certificate) == 1 && fclose(file) == 0,
                "the certificate");
        file = fopen(KeyPath().c_str(), "w");
        Require(file != nullptr &&
                    PEM_write_PrivateKey(file, key, nullptr, nullptr, 0, nullptr, nullptr) == 1 &&
                    fclose(file) == 0,
                "the key");
        X509_free(certificate);
        EVP_PKEY_free(key);
    }
    ~Certificate() {
        remove(CertificatePath().c_str());
        remove(KeyPath().c_str());
        remove(folder_);
    }
    Certificate(const Certificate&) = delete;
    Certificate& operator=(const Certificate&) = delete;

    std::string CertificatePath() const { return std::string(folder_) + "/cert.pem"; }
    std::string KeyPath() const { return std::string(folder_) + "/key.pem"; }

private:
    char folder_[32] = "/tmp/messages_bench.XXXXXX";
};

class OpensslPair {
public:
    explicit OpensslPair(const Certificate& certificate)
        : near_socket_(connection_.fds[0]),
          far_socket_(connection_.fds[1]),
          near_ctx_(SSL_CTX_new(TLS_client_method())),
          far_ctx_(SSL_CTX_new(TLS_server_method())) {
        SSL_CTX_use_certificate_chain_file(far_ctx_, certificate.CertificatePath().c_str());
        SSL_CTX_use_PrivateKey_file(far_ctx_, certificate.KeyPath().c_str(), SSL_FILETYPE_PEM);
        near_ = SSL_new(near_ctx_);
        far_ = SSL_new(far_ctx_);
        SSL_set_fd(near_, connection_.fds[0]);
        SSL_set_fd(far_, connection_.fds[1]);
        Both([this] { Require(SSL_connect(near_) == 1, "SSL_connect"); },
             [this] { Require(SSL_accept(far_) == 1, "SSL_accept"); });
    }
    ~OpensslPair() {
        SSL_free(near_);
        SSL_free(far_);
        SSL_CTX_free(near_ctx_);
        SSL_CTX_free(far_ctx_);
    }
    OpensslPair(const OpensslPair&) = delete;
    OpensslPair& operator=(const OpensslPair&) = delete;

    std::string Cipher() const { return SSL_get_cipher_name(near_); }
    double Run() {
        return Throughput(
            [this](const char* block) {
                Require(SSL_write(near_, block, kBlock) == kBlock, "SSL_write");
            },
            [this](char* block) {
                for (unsigned int total = 0; total < kBlock;) {
                    const int got = SSL_read(far_, block + total, static_cast<int>(kBlock - total));
                    Require(got > 0, "SSL_read");
                    total += static_cast<unsigned int>(got);
                }
            });
    }

private:
    Connection connection_;
    BareSocket near_socket_;
    BareSocket far_socket_;
    SSL_CTX* near_ctx_;
    SSL_CTX* far_ctx_;
    SSL* near_ = nullptr;
    SSL* far_ = nullptr;
};

}  // namespace

void CompareBlocks() {
    Channels plain;
    const Connection connection;
    BareSocket near(connection.fds[0]);
    BareSocket far(connection.fds[1]);
    Compare(
        {"blocks of 64 KiB", "bare send/recv", "MB/s", Contest::kHighIsGood, 0.9},
        [&] { return ChannelThroughput(plain); },
        [&] {
            return Throughput([&](const char* block) { near.Send(block, kBlock); },
                              [&](char* block) { far.Recv(block, kBlock); });
        });

    const Certificate certificate;
    Channel::SetCERTPath(certificate.CertificatePath());
    Channel::SetPriKeyPath(certificate.KeyPath());
    Channels secured;
    Both([&] { Require(secured.near.ConvertToSSLChannel(false) == 0, "conversion"); },
         [&] { Require(secured.far.ConvertToSSLChannel(true) == 0, "conversion"); });
    OpensslPair openssl(certificate);
    const std::string peer = "OpenSSL " + openssl.Cipher();
    Compare(
        {"blocks of 64 KiB over TLS", peer.c_str(), "MB/s", Contest::kHighIsGood, 0.95},
        [&] { return ChannelThroughput(secured); }, [&] { return openssl.Run(); });
}

}  // namespace bench

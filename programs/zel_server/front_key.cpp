// The server's private key and its certificate.
#include <openssl/bio.h>
#include <openssl/ec.h>
#include <openssl/evp.h>
#include <openssl/pem.h>
#include <openssl/rand.h>
#include <openssl/x509.h>

#include <memory>

#include "base/key_fingerprint.h"
#include "base/replace_file.h"
#include "base/whole_file.h"
#include "programs/common/failure.h"
#include "programs/common/text.h"
#include "programs/zel_server/front.h"

namespace zel_server {

namespace {

using programs::Failure;

constexpr size_t kMaxPem = size_t{1024} * 1024;
constexpr long kThirdVersion = 2;

template <typename T, void (*free)(T*)>
struct Freed {
    void operator()(T* object) const { free(object); }
};
template <typename T, void (*free)(T*)>
using Owner = std::unique_ptr<T, Freed<T, free>>;
using Key = Owner<EVP_PKEY, EVP_PKEY_free>;
using KeyContext = Owner<EVP_PKEY_CTX, EVP_PKEY_CTX_free>;
using Certificate = Owner<X509, X509_free>;
struct BioFree {
    void operator()(BIO* bio) const { BIO_free(bio); }
};
using Bio = std::unique_ptr<BIO, BioFree>;

Key MakeKey() {
    const KeyContext context(EVP_PKEY_CTX_new_id(EVP_PKEY_EC, nullptr));
    EVP_PKEY* key = nullptr;
    const bool made =
        context && EVP_PKEY_keygen_init(context.get()) > 0 &&
        EVP_PKEY_CTX_set_ec_paramgen_curve_nid(context.get(), NID_X9_62_prime256v1) > 0 &&
        EVP_PKEY_keygen(context.get(), &key) > 0;
    return Key(made ? key : nullptr);
}

// Clients check the key alone, so the certificate states nothing and never expires.
Certificate MakeCertificate(EVP_PKEY* key) {
    Certificate certificate(X509_new());
    X509* const x509 = certificate.get();
    unsigned char serial[8];
    if (x509 == nullptr || RAND_bytes(serial, sizeof serial) != 1) {
        return nullptr;
    }
    uint64_t number = 1;
    for (const unsigned char byte : serial) {
        number = (number << 7) ^ byte;
    }
    X509_NAME* const name = X509_get_subject_name(x509);
    const bool made = X509_set_version(x509, kThirdVersion) == 1 &&
                      ASN1_INTEGER_set_uint64(X509_get_serialNumber(x509), number >> 1) == 1 &&
                      X509_NAME_add_entry_by_txt(
                          name, "CN", MBSTRING_ASC,
                          reinterpret_cast<const unsigned char*>("zel_server"), -1, -1, 0) == 1 &&
                      X509_set_issuer_name(x509, name) == 1 &&
                      ASN1_TIME_set_string(X509_getm_notBefore(x509), "20000101000000Z") == 1 &&
                      ASN1_TIME_set_string(X509_getm_notAfter(x509), "99991231235959Z") == 1 &&
                      X509_set_pubkey(x509, key) == 1 && X509_sign(x509, key, EVP_sha256()) > 0;
    return made ? std::move(certificate) : nullptr;
}

std::string TextOf(const Bio& bio) {
    char* bytes = nullptr;
    const long size = BIO_get_mem_data(bio.get(), &bytes);
    return size > 0 ? std::string(bytes, static_cast<size_t>(size)) : "";
}

Certificate CertificateIn(const std::string& pem) {
    const Bio bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    return Certificate(bio ? PEM_read_bio_X509(bio.get(), nullptr, nullptr, nullptr) : nullptr);
}

// Rejects keys with a passphrase: the server starts unattended, with nobody to enter one.
int NoPassphrase(char*, int, int, void*) {
    return 0;
}

Key KeyIn(const std::string& pem) {
    const Bio bio(BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size())));
    return Key(bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, NoPassphrase, nullptr) : nullptr);
}

void Write(const std::string& pem) {
    if (!base::ReplaceFile(FrontKey(), pem, 0600)) {
        throw programs::SystemFailure("cannot write the server's key " + FrontKey());
    }
}

}  // namespace

void HaveFrontKey() {
    if (CertificateIn(base::ReadFile(FrontKey(), kMaxPem).value_or(""))) {
        return;
    }
    const Key key = MakeKey();
    const Certificate certificate = key ? MakeCertificate(key.get()) : nullptr;
    const Bio bio(BIO_new(BIO_s_mem()));
    if (!certificate || !bio || PEM_write_bio_X509(bio.get(), certificate.get()) != 1 ||
        PEM_write_bio_PrivateKey(bio.get(), key.get(), nullptr, nullptr, 0, nullptr, nullptr) !=
            1) {
        throw Failure("cannot make a key for the server");
    }
    Write(TextOf(bio));
}

void TakeFrontKey(const std::string& file) {
    const auto pem = base::ReadFile(file, kMaxPem);
    if (!pem) {
        throw programs::SystemFailure("cannot read '" + programs::Printable(file) + "'",
                                      programs::FailureKind::kUsage);
    }
    const Certificate certificate = CertificateIn(*pem);
    const Key key = KeyIn(*pem);
    if (!certificate || !key || X509_check_private_key(certificate.get(), key.get()) != 1) {
        throw Failure(programs::FailureKind::kUsage,
                      "'" + programs::Printable(file) +
                          "' must hold a certificate and its private key without a passphrase, "
                          "both as PEM");
    }
    Write(*pem);
}

std::optional<std::string> Fingerprint() {
    return base::KeyFingerprint(
        CertificateIn(base::ReadFile(FrontKey(), kMaxPem).value_or("")).get());
}

}  // namespace zel_server

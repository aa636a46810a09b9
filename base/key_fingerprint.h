// Needs OpenSSL's libcrypto, which the users of this header link.
#pragma once

#include <openssl/evp.h>
#include <openssl/x509.h>

#include <optional>
#include <string>

namespace base {

/// How a server's key is known: "SHA256:" and the unpadded base64 of the SHA-256 of the DER-encoded
/// public key (SubjectPublicKeyInfo) in the certificate. Nothing when there is no certificate.
inline std::optional<std::string> KeyFingerprint(X509* certificate) {
    constexpr int kDigestSize = 32;
    unsigned char* der = nullptr;
    const int size =
        certificate == nullptr ? 0 : i2d_X509_PUBKEY(X509_get_X509_PUBKEY(certificate), &der);
    unsigned char digest[kDigestSize];
    const bool digested = size > 0 && EVP_Digest(der, static_cast<size_t>(size), digest, nullptr,
                                                 EVP_sha256(), nullptr) == 1;
    OPENSSL_free(der);
    if (!digested) {
        return std::nullopt;
    }
    unsigned char base64[4 * ((kDigestSize + 2) / 3) + 1];
    EVP_EncodeBlock(base64, digest, kDigestSize);
    const std::string text = reinterpret_cast<const char*>(base64);
    return "SHA256:" + text.substr(0, text.find('='));
}

}  // namespace base

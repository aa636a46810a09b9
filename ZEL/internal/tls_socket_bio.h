#pragma once

#include <openssl/bio.h>

#include "ZEL/internal/channel_socket.h"

namespace ZEL {

/// A BIO over a connected socket that never blocks, whatever the descriptor's flags say, and never
/// raises SIGPIPE (OpenSSL's own socket BIO writes with write(2)). Does not close the socket. The
/// end of the stream is a plain 0, not an error of the BIO. Null when there is no memory or no
/// descriptor.
BIO* NewTlsSocketBio(int fd);

/// The polling state of the BIO's readers; owned by the BIO.
Patience& PatienceOf(BIO* bio);

}  // namespace ZEL

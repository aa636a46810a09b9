// Stands in for channel_tls.cpp in programs that carry this library's objects but no TLS library.
#include "ZEL/internal/channel_socket.h"

namespace ZEL {

const ChannelOps kTlsOps = {};

int Channel::ConvertToSSLChannel(bool) {
    return RESULT_SYSTEM;
}

}  // namespace ZEL

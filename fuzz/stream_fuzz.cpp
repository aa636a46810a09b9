// Any bytes from a peer: an error code or a value, and a value that was accepted comes back as it
// was sent.
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <string>

#include "ZEL/log.h"
#include "ZEL/stream.h"
#include "fuzz/require.h"

namespace {

constexpr size_t kMaxInput = 32768;  // what a socket pair holds without a reader

// Connects `channel` to a new socket, which is returned.
int OtherEnd(ZEL::Channel& channel) {
    int fds[2];
    Require(socketpair(AF_UNIX, SOCK_STREAM, 0, fds) == 0 && channel.Open(fds[0], true) == 0);
    return fds[1];
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static const int silent = ZEL::Logger::Initialize(ZEL::Logger::STDERR, -1, "", 0);
    if (silent != 0 || size > kMaxInput) {
        return -1;
    }
    ZEL::Channel channel(256);
    const int peer = OtherEnd(channel);
    Require(write(peer, data, size) == static_cast<ssize_t>(size));
    close(peer);
    ZEL::PStream stream;
    ZEL::PObject value;
    const int result = stream.Recv(channel, value);
    Require(result == 0 || result == ZEL::RESULT_IO || result == ZEL::RESULT_PROTOCOL);
    channel.Close();
    const std::string text = value.toString();
    ZEL::PObject copied = value;
    Require(copied.toString() == text);
    if (result != 0) {
        return 0;  // what a refused value has left behind may itself be refused
    }

    ZEL::Channel sending(kMaxInput);
    Require(channel.Open(OtherEnd(sending), true) == 0);
    Require(stream.Send(sending, value) == 0);
    ZEL::PObject again;
    Require(stream.Recv(channel, again) == 0);
    // A key's leading '_' is lost on the way.
    Require(text.find('_') != std::string::npos || again.toString() == text);
    return 0;
}

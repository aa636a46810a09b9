// The comparisons of messages_bench, a source each, and what they share.
#pragma once

#include <sys/socket.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "ZEL/ipc.h"
#include "ZEL/pobject.h"
#include "bench/messages/rounds.h"

namespace bench {

void CompareTaskMap();   ///< encoding and decoding, beside msgpack; allocations
void CompareCalls();     ///< requests and replies, beside bare sockets and sd-bus
void CompareBlocks();    ///< 64 KiB blocks, beside bare sockets and OpenSSL
void CompareLogLines();  ///< beside spdlog

constexpr unsigned int kCapacity = 81920;  // bytes of an endpoint's rings

/// One field of a message: a number, or, when `texts` holds any, a string or a list of strings.
struct Field {
    const char* key;
    unsigned long long number;
    std::vector<std::string> texts;
    bool IsList() const { return texts.size() > 1; }
    bool IsText() const { return texts.size() == 1; }
};

/// A task as a front end sends it to the daemon: 23 keys.
const std::vector<Field>& TaskFields();

ZEL::PObject ToObject(const std::vector<Field>& fields);

/// The number of bytes of a message on the wire.
size_t WireSize(const ZEL::PObject& message);

/// How often the process has called operator new.
size_t Allocations();

/// Both ends of a unix stream connection. Whoever takes an end closes it.
struct Connection {
    Connection() { Require(socketpair(AF_UNIX, SOCK_STREAM, 0, fds) == 0, "socketpair"); }
    int fds[2];
};

/// A blocking socket without any layer.
class BareSocket {
public:
    explicit BareSocket(int fd) : fd_(fd) {}
    ~BareSocket() { close(fd_); }
    BareSocket(const BareSocket&) = delete;
    BareSocket& operator=(const BareSocket&) = delete;
    void Send(const char* data, size_t size) {
        while (size > 0) {
            const ssize_t sent = send(fd_, data, size, MSG_NOSIGNAL);
            Require(sent > 0, "send");
            data += sent;
            size -= static_cast<size_t>(sent);
        }
    }
    void Recv(char* buffer, size_t size) {
        while (size > 0) {
            const ssize_t got = recv(fd_, buffer, size, 0);
            Require(got > 0, "recv");
            buffer += got;
            size -= static_cast<size_t>(got);
        }
    }

private:
    int fd_;
};

}  // namespace bench

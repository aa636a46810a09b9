// Answers every request with what was asked:  listener PATH|PORT [CERTIFICATE KEY]
// With a certificate and its key, connections are TLS.
#include <unistd.h>

#include <cstdlib>
#include <iostream>
#include <string>

#include "ZEL/ipc.h"
#include "ZEL/stream.h"

int main(int argc, char** argv) {
    if (argc != 2 && argc != 4) {
        std::cerr << "usage: listener PATH|PORT [CERTIFICATE KEY]\n";
        return 2;
    }
    const std::string address = argv[1];
    const bool tls = argc == 4;
    if (tls) {
        ZEL::Channel::SetCERTPath(argv[2]);
        ZEL::Channel::SetPriKeyPath(argv[3]);
    }
    ZEL::IPCListener listener;
    const bool is_path = address.find('/') != std::string::npos;
    const int port = is_path ? listener.prepare(address) : listener.prepare(atoi(argv[1]));
    if (port < 0) {
        std::cerr << "cannot listen on " << address << "\n";
        return 1;
    }
    std::cout << "listening on " << (is_path ? address : std::to_string(port)) << std::endl;

    for (unsigned long long answered = 0;;) {
        if (!listener.isReady()) {
            continue;  // every three seconds: the place to look whether to go on
        }
        ZEL::Channel channel(81920);
        const int fd = listener.accept();
        if (channel.Open(fd, true) != 0) {
            close(fd);
            continue;
        }
        if (tls && channel.ConvertToSSLChannel(true) != 0) {
            continue;
        }
        ZEL::PStream stream;
        for (ZEL::PObject request; stream.Recv(channel, request) == 0; request.clear()) {
            ZEL::PObject reply;
            reply["echo"] = request;
            reply["answered"] = ++answered;
            if (stream.Send(channel, reply) != 0) {
                break;
            }
        }
    }
}

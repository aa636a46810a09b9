// Sends one request and prints the reply:  sender PATH|PORT TEXT [CA HOSTNAME]
// With a CA file and a host name, the connection is TLS and the server must prove that name.
#include <iostream>
#include <string>

#include "ZEL/ipc.h"
#include "ZEL/stream.h"

namespace {

bool IsPath(const std::string& address) {
    return address.find('/') != std::string::npos;
}

int Ask(const std::string& address, const ZEL::PObject& request, ZEL::PObject& reply) {
    ZEL::IPCSender sender;
    const int connected = IsPath(address) ? sender.connect(address) : sender.connect(stoi(address));
    return connected == 0 ? sender.send(request, true, reply) : connected;
}

int AskOverTls(const std::string& address, const std::string& host, const ZEL::PObject& request,
               ZEL::PObject& reply) {
    ZEL::Channel channel(81920);
    channel.SetAllowUntrust(false);
    channel.SetSSLHostname(host);
    int result =
        IsPath(address) ? channel.Open(address.c_str()) : channel.Open("127.0.0.1", stoi(address));
    ZEL::PStream stream;
    if (result == 0 && (result = channel.ConvertToSSLChannel(false)) == 0 &&
        (result = stream.Send(channel, request)) == 0) {
        result = stream.Recv(channel, reply);
    }
    return result;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 3 && argc != 5) {
        std::cerr << "usage: sender PATH|PORT TEXT [CA HOSTNAME]\n";
        return 2;
    }
    ZEL::PObject request, reply;
    request["text"] = argv[2];
    request["from"] = "sender";
    if (argc == 5) {
        ZEL::Channel::SetVerifyCAPath(argv[3]);
    }
    const int result =
        argc == 3 ? Ask(argv[1], request, reply) : AskOverTls(argv[1], argv[4], request, reply);
    if (result != 0) {
        std::cerr << "no reply: " << result << "\n";
        return 1;
    }
    std::cout << reply["echo"].toString() << "\n";
}

#include "programs/common/transport_words.h"

namespace programs {

using TARQ::Backup::RsyncServer;
using TARQ::Backup::ServerTransport;

std::string TransportWords(const RsyncServer& server) {
    const int port =
        server.port != 0 ? server.port : TARQ::Backup::DefaultServerPort(server.transport);
    const std::string where = ", port " + std::to_string(port);
    switch (server.transport) {
        case ServerTransport::TLS:
            return "TLS" + where + ", key " + server.fingerprint;
        case ServerTransport::SSH:
            return "ssh" + where + ", host key " + server.fingerprint;
        default:
            return "plain" + where + ", unprotected";
    }
}

std::string TransportWords(const std::string& server, bool task_says_ssh,
                           unsigned int task_ssh_port) {
    try {
        if (const auto known = TARQ::Backup::FindServer(server)) {
            return TransportWords(*known);
        }
    } catch (const TARQ::Backup::ServersError& error) {
        return error.what();
    }
    if (task_says_ssh) {
        const std::string port =
            task_ssh_port == 0 ? "" : ", port " + std::to_string(task_ssh_port);
        return "ssh" + port + ", with whatever host key comes first (zelctl trust " + server +
               " --ssh)";
    }
    return TARQ::Backup::IsLoopbackHost(server)
               ? "plain, within this machine"
               : "plain, unprotected (zelctl trust " + server + ")";
}

}  // namespace programs

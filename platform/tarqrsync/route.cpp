#include "platform/tarqrsync/route.h"

#include <optional>

#include "tarq/rsync_servers.h"

namespace TARQ {
namespace Backup {

namespace {

Transport DaemonTransport(ServerTransport transport) {
    switch (transport) {
        case ServerTransport::TLS:
            return Transport::DAEMON_OVER_TLS;
        case ServerTransport::SSH:
            return Transport::DAEMON_OVER_SSH;
        default:
            return Transport::DAEMON;
    }
}

}  // namespace

Route RouteOf(const Settings& settings, const RunOptions& options,
              const base::RsyncConfig& config) {
    Route route;
    route.name = options.server.empty() ? settings.host : options.server;
    const std::optional<RsyncServer> server = FindServer(route.name);
    route.is_known = server.has_value();
    if (!settings.is_command && settings.module.compare(0, 1, "/") == 0) {
        route.transport = Transport::DIRECTORY_OVER_SSH;
        route.port = settings.port;
        if (server && server->transport == ServerTransport::SSH) {
            route.port = server->port;
        }
    } else if (server) {
        route.transport = DaemonTransport(server->transport);
        route.port = server->port;
        route.fingerprint = server->fingerprint;
    } else {
        route.transport = settings.ssh ? Transport::DAEMON_OVER_SSH : Transport::DAEMON;
        route.port = settings.port;
    }
    if (route.port == 0) {
        switch (route.transport) {
            case Transport::DAEMON:
                route.port = config.daemon_port;
                break;
            case Transport::DAEMON_OVER_TLS:
                route.port = DefaultServerPort(ServerTransport::TLS);
                break;
            default:
                break;  // ssh's own, which its configuration may say
        }
    }
    return route;
}

}  // namespace Backup
}  // namespace TARQ

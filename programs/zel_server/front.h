// The front: HAProxy, which accepts connections from the network and forwards them, with the
// client's address, to the socket of the rsync daemon. It holds the server's private key.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/port.h"
#include "programs/zel_server/server_config.h"

namespace zel_server {

/// Simultaneous connections from one address (of IPv6: from one /64 network), and on one port in
/// total.
inline constexpr int kMaxPerAddress = 64;
inline constexpr int kMaxPerPort = 640;

/// An address and port that the front listens on.
struct Endpoint {
    std::string address;  ///< as configured; empty: all addresses of this machine
    int port = 0;
};
/// All endpoints: with TLS for the network, without TLS for this machine (where ssh tunnels end),
/// and without TLS for the network if the admin has chosen so.
std::vector<Endpoint> Endpoints(const ServerConfig& config);

/// Creates the server's key (P-256) and a self-signed certificate if there is none. Throws Failure.
void HaveFrontKey();
/// Installs the admin's own key and certificate, from a PEM file with both and optionally the rest
/// of the certificate chain. Throws Failure when it is not usable.
void TakeFrontKey(const std::string& file);
/// The fingerprint by which clients know this server: "SHA256:" and the base64 of the SHA-256 of
/// the public key. Nothing when there is no key or it may not be read.
std::optional<std::string> Fingerprint();

/// Writes the front's configuration from the server's own, creates the key if there is none, and
/// returns the front's command line, which runs in the foreground. Throws Failure.
std::vector<std::string> PrepareFront(const ServerConfig& config);
/// Whether the process is this server's front.
bool IsOurFront(pid_t pid);
/// Whether the configuration or the key has changed since the front was started.
bool IsOutdated(const ServerConfig& config, pid_t front);

/// Who listens on the ports of the configuration.
std::vector<Listener> Listeners(const ServerConfig& config);
/// Whether the front listens on all configured endpoints.
bool ServesAll(const ServerConfig& config, const std::vector<Listener>& listeners);
/// Another program that listens on an address and port that this server needs.
std::optional<Listener> OtherHolder(const ServerConfig& config,
                                    const std::vector<Listener>& listeners);

/// The user that the front runs as: haproxy for a system-wide server, otherwise the calling user.
/// Throws Failure when there is no such user.
uid_t FrontUser();
gid_t FrontGroup();

}  // namespace zel_server

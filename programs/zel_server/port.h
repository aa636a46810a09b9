// The ports that the server listens on, as the kernel sees them.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace zel_server {

/// A listening socket, and the process that owns it.
struct Listener {
    std::string address;  ///< numeric; "0.0.0.0" and "::" are all addresses
    int port = 0;
    pid_t pid = 0;        ///< 0: unknown, as it belongs to another user
    std::string program;  ///< name of the process

    bool IsEverywhere() const { return address == "0.0.0.0" || address == "::"; }
};

/// Who listens on a TCP port of this machine.
std::vector<Listener> ListenersOn(int port);

/// The numeric addresses of `address` (a name or a number; empty: all). Empty when it cannot be
/// resolved.
std::vector<std::string> NumericAddresses(const std::string& address);

/// Tests whether a server could listen on that port of the address (empty: of all addresses).
/// Returns 0, or the errno of the first address that fails.
int TryToListen(const std::string& address, int port);

}  // namespace zel_server

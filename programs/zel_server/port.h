// The port that the rsync daemon listens on, as the kernel sees it.
#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace zel_server {

/// A socket that listens, and the process that holds it.
struct Listener {
    std::string address;  ///< numeric; "0.0.0.0" and "::" are all addresses
    pid_t pid = 0;        ///< 0: it cannot be seen, being another user's
    std::string program;  ///< its name

    bool IsEverywhere() const { return address == "0.0.0.0" || address == "::"; }
};

/// Who listens on a TCP port of this machine.
std::vector<Listener> ListenersOn(int port);

/// `address` (a name, a number; empty: everywhere) as numbers. Empty when nothing of the kind is
/// known.
std::vector<std::string> NumericAddresses(const std::string& address);

/// Whether the port of that address, of all addresses when it is empty, can be listened on: 0, or
/// the errno of the first address that cannot.
int TryToListen(const std::string& address, int port);

}  // namespace zel_server

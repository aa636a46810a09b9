// How to reach the server: the options that several commands share.
#pragma once

#include <string>

#include "ZEL/sync_obj.h"

namespace CLI {
class App;
}

namespace zelctl {

struct ConnectionOptions {
    std::string server;  ///< name or address
    std::string user;
    std::string password_file;
    bool ssh = false;
    unsigned int ssh_port = 22;
    unsigned int timeout = 600;  ///< seconds
    bool compress = false;
    bool delta = false;

    void AddTo(CLI::App* command);

    /// Asks for the password where needed.
    ZEL::SyncInfo ToSyncInfo() const;
};

/// Enters `server` as the address or the name that it is, and forgets the other.
void SetServer(const std::string& server, ZEL::SyncInfo& info);

}  // namespace zelctl

// How to reach the server: the options that several commands share.
#pragma once

#include <CLI/CLI.hpp>
#include <string>

#include "ZEL/rsyncer.h"
#include "programs/zelctl/exit_codes.h"

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

    /// Fills `info`, asking for the password where needed.
    ExitCode ToSyncInfo(ZEL::SyncInfo& info) const;
};

/// Enters `server` as the address or the name that it is, and forgets the other.
void SetServer(const std::string& server, ZEL::SyncInfo& info);

/// What a failed operation came to, for a person: the server's words, rsync's, or where to look.
std::string Explain(int status, const TARQ::Backup::RunReport& report);

/// Whether `status` is the server's refusal rather than a failure on the way.
ExitCode CodeOf(int status);

}  // namespace zelctl

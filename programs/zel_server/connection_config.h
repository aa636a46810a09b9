// What the rsync daemon of one connection is configured with: rsyncd.conf, and the modules that are
// open when it starts.
//
// It has a file of its own, since a daemon that included the folder of the modules would serve
// nobody when one of them was closed between its look at the folder and that at the module.
#pragma once

#include <sys/types.h>

#include <string>

namespace zel_server {

/// Owns the file for the daemon that is the process `process`, and removes it when destroyed.
class ConnectionConfig {
public:
    ConnectionConfig() = default;
    explicit ConnectionConfig(pid_t process);
    ConnectionConfig(ConnectionConfig&& other) noexcept;
    ConnectionConfig& operator=(ConnectionConfig&& other) noexcept;
    ~ConnectionConfig();

    /// Written by the process itself: the file's path, or "" with errno set on failure.
    static std::string Write();
    /// Makes the folder of the files, with none in it. False, with errno set, on failure.
    static bool MakeFolder();

private:
    std::string path_;  // empty: owns none
};

}  // namespace zel_server

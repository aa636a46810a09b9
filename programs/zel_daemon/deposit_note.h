#pragma once

#include <cstdint>
#include <string>

namespace zel_daemon {

/// What an account of a server has last taken as this machine's configuration.
struct DepositNote {
    std::string server;
    std::string user;
    std::string digest;
    int64_t time = 0;  ///< seconds since the epoch
};

}  // namespace zel_daemon

// The configuration of this machine, left with a server and fetched from there.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "ZEL/sync_obj.h"

namespace programs {

/// What a client has left with the server.
struct Deposit {
    std::string client;  ///< its identity
    std::string name;    ///< its name
    std::string server;  ///< its name for the server
    int64_t time = 0;    ///< seconds since the epoch
    uint64_t bytes = 0;
};

/// As many bytes as a server takes.
inline constexpr size_t kMaxDepositBytes = size_t{1} << 20;

/// One connection to a server. Failures are thrown as RunFailure; its status is kUnknownCommand for
/// a server of an earlier version, which keeps no deposits.
///
/// Threads: for use by one thread; `cancel` may be set by any thread, and by a signal handler.
class DepositSession {
public:
    /// `cancel` must outlive this object.
    DepositSession(const ZEL::SyncInfo& info, const std::atomic<bool>& cancel);
    ~DepositSession();
    DepositSession(const DepositSession&) = delete;
    DepositSession& operator=(const DepositSession&) = delete;

    /// Finds an address at which the server answers. Changes nothing there.
    void Connect();
    /// Leaves the text there, for this machine and account.
    void Leave(const std::string& text);
    /// What the account's clients have left there, the youngest of each first.
    std::vector<Deposit> List();
    std::string Fetch(const Deposit& deposit);

private:
    struct Impl;
    std::unique_ptr<Impl> impl_;
};

}  // namespace programs

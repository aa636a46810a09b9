// Leaves this machine's configuration with the servers that its tasks go to, so that a machine that
// is lost can be set up again from there.
#pragma once

#include <atomic>
#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"
#include "programs/zel_daemon/backoff.h"
#include "programs/zel_daemon/deposit_note.h"
#include "programs/zel_daemon/event_loop.h"

namespace zel_daemon {

/// What a deposit is made of, and where it goes.
struct DepositOrder {
    ZEL::PObject::Array tasks;            ///< by key; a password among them goes no further
    std::vector<ZEL::SyncInfo> accounts;  ///< with their passwords, each account of a server once
    std::vector<DepositNote> taken;       ///< what the servers have
    /// A recovery of this machine has not come to its end: it has not got all that is to be left.
    bool waits = false;
};

/// Works on a thread of its own, some seconds after the last change, on connections of its own: no
/// run waits for it, and none fails by it. A server that is away is tried again later. Without a
/// task nothing is left anywhere, so that a machine that was set up anew does not push out what is
/// there.
class Depositor {
public:
    /// `collect` and `note` (a server has taken what it says) are called on the loop's thread while
    /// that runs.
    Depositor(EventLoop& loop, std::function<DepositOrder()> collect,
              std::function<void(const DepositNote&)> note);
    /// Cancels what is under way.
    ~Depositor();
    Depositor(const Depositor&) = delete;
    Depositor& operator=(const Depositor&) = delete;

    /// Tasks or shares may be others than before, or a server may be reached again. Any thread may
    /// call.
    void Changed();

private:
    using Account = std::pair<std::string, std::string>;  // server and user

    void Work();
    bool WaitForWork(std::unique_lock<std::mutex>& lock);
    std::optional<DepositOrder> Collect();
    void Deposit(const DepositOrder& order);
    void Try(const ZEL::SyncInfo& account, const std::string& text, const DepositNote& note);
    int64_t NextTry() const;

    EventLoop& loop_;
    const std::function<DepositOrder()> collect_;
    const std::function<void(const DepositNote&)> note_;
    std::atomic<bool> end_{false};
    std::mutex mutex_;
    std::condition_variable wake_;
    std::optional<int64_t> quiet_at_;    // when the last change is long enough ago
    std::optional<DepositOrder> order_;  // that was collected
    // The thread's alone: what failed, and when to look again though nothing has changed.
    std::map<Account, Backoff> failures_;
    int64_t look_again_ = INT64_MAX;
    std::thread thread_;  // declared last, as it uses all other members
};

}  // namespace zel_daemon

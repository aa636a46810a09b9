// The heartbeat of a long run.
#pragma once

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

#include "ZEL/sync_obj.h"

namespace programs {

/// Reports once a minute, from its own thread and connection, that a task is alive: a server that
/// hears nothing for two minutes considers the task dead. A failed report does not end the run.
class Beacon {
public:
    Beacon(const ZEL::SyncInfo& info, std::string task);
    ~Beacon() { Stop(); }
    Beacon(const Beacon&) = delete;
    Beacon& operator=(const Beacon&) = delete;

    /// The share that is being pushed, which the server then keeps open. Empty: none.
    void SetShare(const std::string& share);

    /// Ends the thread. Returns whether any report was sent.
    bool Stop();

private:
    void Run();

    ZEL::SyncInfo info_;
    std::string task_;
    std::mutex mutex_;
    std::string share_;  // guarded by the mutex
    std::condition_variable wake_;
    std::atomic<bool> stop_{false};
    bool sent_ = false;  // written by the thread; read after it was joined
    std::thread thread_;
};

}  // namespace programs

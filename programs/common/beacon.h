// The sign of life of a run that lasts.
#pragma once

#include <atomic>
#include <condition_variable>
#include <mutex>
#include <string>
#include <thread>

#include "ZEL/sync_obj.h"

namespace programs {

/// Tells the server once a minute that a task is alive, from a thread and a connection of its own:
/// a server that hears nothing for two takes the task for dead. A beacon that fails is no reason to
/// end the run.
class Beacon {
public:
    Beacon(const ZEL::SyncInfo& info, std::string task);
    ~Beacon() { Stop(); }
    Beacon(const Beacon&) = delete;
    Beacon& operator=(const Beacon&) = delete;

    /// Ends the thread. Whether the server was told anything.
    bool Stop();

private:
    void Run();

    ZEL::SyncInfo info_;
    std::string task_;
    std::mutex mutex_;
    std::condition_variable wake_;
    std::atomic<bool> stop_{false};
    bool sent_ = false;  // the thread's until it was joined
    std::thread thread_;
};

}  // namespace programs

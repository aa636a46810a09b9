#include "programs/common/beacon.h"

#include <chrono>
#include <system_error>
#include <utility>

#include "ZEL/log.h"
#include "ZEL/rsyncer.h"

namespace programs {

namespace {

constexpr std::chrono::seconds kEvery(60);

}  // namespace

Beacon::Beacon(const ZEL::SyncInfo& info, std::string task) : info_(info), task_(std::move(task)) {
    try {
        thread_ = std::thread([this] { Run(); });
    } catch (const std::system_error& error) {
        ZEL::Logger::LogMsg(ZEL::Logger::LEVEL_WARNING,
                            "[WARNING] task_run(%d): no thread to tell the server that the run is "
                            "alive: %s\n",
                            __LINE__, error.what());
    }
}

bool Beacon::Stop() {
    if (thread_.joinable()) {
        {
            const std::lock_guard<std::mutex> lock(mutex_);
            stop_ = true;
        }
        wake_.notify_one();
        thread_.join();
    }
    return sent_;
}

void Beacon::Run() {
    ZEL::Rsyncer rsyncer;
    rsyncer.SetTaskSetup([this](ZEL::Rsyncer::RsyncTask& task) {
        task.SetCanceller([this] { return stop_.load(); });
    });
    bool ready = false;
    std::unique_lock<std::mutex> lock(mutex_);
    while (!wake_.wait_for(lock, kEvery, [this] { return stop_.load(); })) {
        lock.unlock();
        ready = ready || rsyncer.Initialize(info_) == 0;
        int status = 0;
        if (ready) {
            sent_ = true;
            rsyncer.SendBeacon(task_, status);
        }
        lock.lock();
    }
}

}  // namespace programs

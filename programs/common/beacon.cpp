#include "programs/common/beacon.h"

#include <chrono>
#include <list>
#include <system_error>
#include <utility>

#include "ZEL/log.h"
#include "ZEL/rsyncer.h"
#include "programs/common/task_fields.h"

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

void Beacon::SetShare(const std::string& share) {
    const std::lock_guard<std::mutex> lock(mutex_);
    share_ = share;
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
        TARQ::Backup::RunOptions options;
        options.server = ServerOf(info_);
        task.setRunOptions(options);
    });
    bool ready = false;
    std::unique_lock<std::mutex> lock(mutex_);
    while (!wake_.wait_for(lock, kEvery, [this] { return stop_.load(); })) {
        const std::string share = share_;
        lock.unlock();
        ready = ready || rsyncer.Initialize(info_) == 0;
        std::list<std::string> lines;
        if (ready && rsyncer.GenSendBeaconCmd(task_, lines) == 0) {
            if (!share.empty()) {
                lines.push_back("shareName=\"" + share + "\"");
            }
            sent_ = true;
            ZEL::Rsyncer::RsyncTask beacon;
            rsyncer.InitRsyncTask(beacon, false);
            beacon.ExecuteCmd(lines, nullptr);
        }
        lock.lock();
    }
}

}  // namespace programs

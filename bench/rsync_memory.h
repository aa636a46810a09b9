// What the rsyncs of a client and of a server need of memory.
#pragma once

#include <algorithm>
#include <array>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "bench/client_and_server.h"

namespace bench {

/// Looks ten times a second, for as long as it stands. Of memory that several processes share each
/// has its part.
class RsyncMemory {
public:
    RsyncMemory() : thread_([this] { Watch(); }) {}
    ~RsyncMemory() { Stop(); }
    RsyncMemory(const RsyncMemory&) = delete;
    RsyncMemory& operator=(const RsyncMemory&) = delete;

    void Stop() {
        stop_ = true;
        if (thread_.joinable()) {
            thread_.join();
        }
    }

    /// The most that all of an end had at once, in KiB. REQUIRES Stop().
    uint64_t MostOfClients() const { return most_[0]; }
    uint64_t MostOfServers() const { return most_[1]; }

private:
    void Watch() {
        while (!stop_) {
            std::array<uint64_t, 2> now = {};
            std::error_code ended;
            for (std::filesystem::directory_iterator at("/proc", ended), end; !ended && at != end;
                 at.increment(ended)) {
                const std::string folder = at->path().string();
                std::string words;
                std::getline(std::ifstream(folder + "/cmdline"), words);
                if (words.compare(0, 6, std::string("rsync\0", 6)) == 0) {
                    const bool is_server = words.compare(6, 8, "--daemon") == 0;
                    now[is_server] += ProcNumber(folder + "/smaps_rollup", "Pss");
                }
            }
            for (size_t i = 0; i < now.size(); ++i) {
                most_[i] = std::max(most_[i], now[i]);
            }
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
    }

    std::array<uint64_t, 2> most_ = {};
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

}  // namespace bench

// Log calls with the same arguments: filtered out, and written to a file with a flush a line.
#include <spdlog/sinks/basic_file_sink.h>
#include <spdlog/spdlog.h>

#include <cstdlib>

#include "ZEL/log.h"
#include "bench/messages/contests.h"

namespace bench {

namespace {

using ZEL::Logger;

class Folder {
public:
    Folder() { Require(mkdtemp(path_) != nullptr, "mkdtemp"); }
    ~Folder() {
        remove((path_ + std::string("/ours")).c_str());
        remove((path_ + std::string("/peer")).c_str());
        remove(path_);
    }
    Folder(const Folder&) = delete;
    Folder& operator=(const Folder&) = delete;
    std::string operator/(const char* name) const { return path_ + std::string("/") + name; }

private:
    char path_[32] = "/tmp/messages_bench.XXXXXX";
};

template <typename Step>
double NanosecondsEach(int count, const Step& step) {
    return Seconds([&] {
               for (int i = 0; i < count; ++i) {
                   step(i);
               }
           }) /
           count * 1e9;
}

}  // namespace

void CompareLogLines() {
    constexpr int kFiltered = 10000000;
    constexpr int kWritten = 10000;  // below the size at which our file is rotated
    const Folder folder;
    const auto peer = spdlog::basic_logger_mt("bench", folder / "peer");
    peer->set_level(spdlog::level::info);
    peer->flush_on(spdlog::level::info);
    const std::string our_path = folder / "ours";
    const auto start_file = [&] {
        Logger::Destroy();
        Require(Logger::Initialize(Logger::LOGFILE, Logger::LEVEL_INFO, our_path, 2) == 0, "log");
    };
    start_file();
    Compare(
        {"log call that is filtered out", "spdlog", "ns", Contest::kLowIsGood, 1.5},
        [] {
            return NanosecondsEach(kFiltered, [](int i) {
                Logger::LogMsg(Logger::LEVEL_DEBUG, "[DEBUG] ZEL/bench(%d): read %d bytes\n",
                               __LINE__, i);
            });
        },
        [&] {
            return NanosecondsEach(kFiltered, [&](int i) {
                peer->debug("[DEBUG] ZEL/bench({}): read {} bytes", __LINE__, i);
            });
        });
    Compare(
        {"log line to a file, flushed", "spdlog basic file sink", "ns", Contest::kLowIsGood, 1.0},
        [&] {
            start_file();
            return NanosecondsEach(kWritten, [](int i) {
                Logger::LogMsg(Logger::LEVEL_INFO, "[INFO] ZEL/bench(%d): read %d bytes\n",
                               __LINE__, i);
            });
        },
        [&] {
            return NanosecondsEach(kWritten, [&](int i) {
                peer->info("[INFO] ZEL/bench({}): read {} bytes", __LINE__, i);
            });
        });
    Logger::Destroy();
}

}  // namespace bench

// What the daemon costs with many tasks, with a large tree, at rest.
//
//     cmake --preset bench && cmake --build --preset bench --target daemon_bench
//     build/bench/bin/daemon_bench [FOLDERS]
//
// The daemon, zelctl and the server are the real ones, on loopback. Makes a tree of 100,000
// folders, unless another number is given, below $TMPDIR. Runs alternate with their peers', medians
// are compared; each line ends in the ratio and what is wanted of it.
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>

#include "ZEL/ipc.h"
#include "bench/client_and_server.h"
#include "bench/compare.h"
#include "bench/large_tree.h"

namespace {

namespace fs = std::filesystem;
using namespace bench;
using ZEL::PObject;

constexpr int kTasks = 1000;
constexpr int kLists = 41;
constexpr int kStarts = 5;
constexpr int kIdleSeconds = 10;

class Bench : ClientAndServer {
public:
    void List() {
        PObject task = TaskOf("", ZEL::SCHD_MODE_WEEKLY, "data");
        task["week_schd"] = "1111111";
        task["schedule_begin_hour"] = 3;
        ZEL::IPCSender sender;
        Must(sender.connect(daemon_.Socket()) == 0, "the daemon does not answer");
        for (int i = 0; i < kTasks; ++i) {
            task["name"] = "task " + std::to_string(10000 + i);
            PObject reply;
            Must(sender.send(task, true, reply) == 0 && reply["result"].asInt32() == 0,
                 reply.toString());
        }
        const std::string client = root_.Path("client");
        const auto ours = [&] {
            return Milliseconds([&] { Run(client, {ZELCTL, "task", "list"}); });
        };
        const auto theirs = [&] {
            return Milliseconds([&] {
                Run(client,
                    {"sqlite3", "-readonly", "-column",
                     client + "/usr/tarq/etc/zel_daemon/tasks.db",
                     "SELECT name, share_list, server_ip, schedule_mode, week_schd, "
                     "schedule_begin_hour, schedule_begin_min, paused, (SELECT result FROM runs "
                     "WHERE task = tasks.id ORDER BY id DESC LIMIT 1), (SELECT end_time FROM runs "
                     "WHERE task = tasks.id ORDER BY id DESC LIMIT 1), (SELECT count(*) FROM "
                     "events WHERE task = tasks.id) FROM tasks ORDER BY name"});
            });
        };
        Compare("zelctl task list, 1,000 tasks", ours, "sqlite3, the same of its file", theirs,
                kLists, "at most 1.5");
    }

    /// Beside a program that does nothing at all. What was added is first left with the server.
    void Idle() {
        const auto rests = [&] {
            const uint64_t before = Switches();
            std::this_thread::sleep_for(std::chrono::seconds(5));
            return Switches() == before;
        };
        Must(test::Await(rests, 120), "the daemon does not come to rest");
        const uint64_t switches = Switches();
        const double cpu = CpuMilliseconds();
        std::this_thread::sleep_for(std::chrono::seconds(kIdleSeconds));
        std::printf(
            "%-34s %9llu wake-ups, %.0f ms of CPU time in %d s (wanted: 0 to 1 wake-ups; sleep: "
            "0)\n",
            "at rest, 1,000 tasks", static_cast<unsigned long long>(Switches() - switches),
            CpuMilliseconds() - cpu, kIdleSeconds);
        std::fflush(stdout);
    }

    void LargeTree(int folders) {
        const std::string tree = root_.Path("tree");
        bench::MakeTree(tree, folders);
        AddShare("tree");
        server_.Stop();  // the daemon has nobody to send the tree to
        const size_t before = ResidentKilobytes();
        AddTask("tree", ZEL::SCHD_MODE_REALTIME, "tree");
        AwaitFolders(folders);
        const size_t after = ResidentKilobytes();
        std::printf("%-34s %9zu KiB resident, %zu KiB without the folders: %zu bytes a folder\n",
                    "1,000 tasks and the large tree", after, before,
                    (after - std::min(before, after)) * 1024 / static_cast<size_t>(folders));
        const auto find = [&] {
            return Milliseconds([&] {
                Run("", {"find", tree, "-type", "d", "-fprintf", "/dev/null", "%p\n"});
            });
        };
        const auto start = [&](bool whole) {
            daemon_.End(SIGTERM);
            return Milliseconds([&] {
                daemon_.Start();
                if (whole) {
                    AwaitFolders(folders);
                }
            });
        };
        Compare(
            "start until it answers", [&] { return start(false); }, "find -type d of the tree",
            find, kStarts, "at most 1");
        Compare(
            "start until all is watched", [&] { return start(true); }, "find -type d of the tree",
            find, kStarts, "at most 3");
    }

private:
    void AwaitFolders(int folders) const {
        const bool all = test::Await(
            [&] {
                const PObject status = daemon_.Ask("daemon_status");
                return status["folders"].asInt32() == folders && status["searching"].asInt32() == 0;
            },
            120);
        Must(all, "not all folders are watched; see fs.inotify.max_user_watches");
    }

    uint64_t Switches() const {
        uint64_t sum = 0;
        for (const auto& thread : fs::directory_iterator(ProcFolder() + "/task")) {
            sum += ProcNumber(thread.path() / "status", "voluntary_ctxt_switches");
        }
        return sum;
    }
    double CpuMilliseconds() const {
        std::ifstream file(ProcFolder() + "/stat");
        std::string word;
        double ticks = 0;
        for (int i = 1; file >> word && i <= 15; ++i) {
            ticks += i == 14 || i == 15 ? std::stod(word) : 0;
        }
        return ticks * 1000 / static_cast<double>(sysconf(_SC_CLK_TCK));
    }
};

}  // namespace

int main(int argc, char** argv) {
    try {
        Bench bench;
        bench.List();
        bench.Idle();
        bench.LargeTree(argc > 1 ? std::atoi(argv[1]) : 100000);
    } catch (const std::exception& error) {
        Fail(error.what());
    }
}

// What changes cost that the daemon sends: one, many, what was moved, and none after a restart; and
// whether a slow server costs the tasks of others.
//
//     cmake --preset bench && cmake --build --preset bench --target changes_bench
//     build/bench/bin/changes_bench [FILES [one | scattered | moved | fair | large]]
//
// The daemon and the server are the real ones, on loopback. Makes shares of 200,000 files, unless
// another number is given, below $TMPDIR, and their copies. Runs alternate with their peers',
// medians are compared; each line ends in the ratio and what is wanted of it.
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <list>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "base/unique_fd.h"
#include "bench/client_and_server.h"
#include "bench/compare.h"
#include "bench/counting_relay.h"
#include "bench/rsync_memory.h"

namespace {

namespace fs = std::filesystem;
using namespace bench;

constexpr int kChanges = 41;
constexpr int kScatteredRuns = 15;
constexpr int kMoves = 15;
constexpr int kFolders = 1000;
constexpr int kFilesEach = 50;
constexpr int kFewMoved = 2000;
constexpr int kFewFiles = 10000;
constexpr int kServers = 10;
constexpr int kTasksEach = 100;

class Bench : ClientAndServer {
public:
    void One() {
        AddTask("one", ZEL::SCHD_MODE_REALTIME, "data");
        const std::string copy = root_.Path("storage/data");
        Must(test::Await([&] { return fs::exists(copy + "/first") && IsIdle("one"); }),
             "the first copy was not made");
        fs::create_directories(root_.Path("peer"));
        int number = 0;
        const auto ours = [&] {
            return UntilThere(
                copy, [&] { root_.Write("data/file", std::to_string(++number)); }, "one");
        };
        const auto theirs = [&] {
            root_.Write("peer/file", std::to_string(++number));
            return Milliseconds([&] {
                BareByte();
                BareByte();
                Bare({"-rlptgo", "--modify-window=-1", "-D", "-A", "-X", "--numeric-ids",
                      "--whole-file", "--delete-after", "--timeout=600", "--relative",
                      root_.Path("peer") + "/./file", Server("plain/")});
                BareByte();
            });
        };
        Compare("a change, until it is there", ours, "rsync of it and three bare commands", theirs,
                kChanges, "at most 1.3");
        daemon_.Ask("task_remove", "one");
    }

    // Files of a share of 1,000 folders with 50 each, until the server has confirmed all of them.
    void Scattered() {
        for (int i = 0; i < kFolders * kFilesEach; ++i) {
            root_.Write(ScatteredFile("scattered", i), "as it was");
            root_.Write(ScatteredFile("peers", i), "as it was");
        }
        PushOnChange("scattered", 120);
        Bare({"-r", "-t", root_.Path("peers") + "/", Server("plain/")});
        for (const int count : {1, 10, 100, 1000}) {
            int turn = 0;
            const auto change = [&](const std::string& share) {
                std::string last;
                std::string names;
                for (int i = 0; i < count; ++i) {
                    const int file = i * (kFolders * kFilesEach / count) + turn % kFilesEach;
                    last = ScatteredFile("", file);
                    root_.Write(share + last,
                                std::to_string(turn) + "th of " + std::to_string(count));
                    names += last + '\n';
                }
                root_.Write("names", names);
                return last;
            };
            const auto ours = [&] {
                ++turn;
                const std::string last = change("scattered");
                const std::string content = test::ReadFile(root_.Path("scattered") + last);
                return Milliseconds([&] {
                           Until([&] {
                               return test::ReadFile(root_.Path("storage/scattered") + last) ==
                                          content &&
                                      IsIdle("scattered");
                           });
                       }) -
                       kGatherMs;
            };
            const auto theirs = [&] {
                change("peers");
                return Milliseconds([&] {
                    BareByte();
                    Bare({"-rlptgo", "--modify-window=-1", "-D", "-A", "-X", "--numeric-ids",
                          "--whole-file", "--delete-after", "--timeout=600", "--backup",
                          "--backup-dir=/replaced", "--files-from=" + root_.Path("names"),
                          root_.Path("peers") + "/", Server("plain/")});
                    BareByte();
                });
            };
            const std::string what = std::to_string(count) + " scattered changes";
            Compare(what.c_str(), ours, "rsync --backup of them, two commands", theirs,
                    kScatteredRuns, "at most 1.3");
        }
        daemon_.Ask("task_remove", "scattered");
    }

    // A folder goes to and fro.
    void Moved(int files) {
        const std::string name = "moved" + std::to_string(files);
        for (int i = 0; i < files; ++i) {
            root_.Write(name + "/here/" + std::to_string(i / 100) + "/" + std::to_string(i),
                        "file");
        }
        std::this_thread::sleep_for(std::chrono::seconds(1));  // none is so young as to be doubtful
        PushOnChange(name, 600);
        const CountingRelay relay(Relayed());
        const std::string share = root_.Path(name);
        const std::string copy = root_.Path("storage/" + name);
        bool there = false;
        uint64_t most = 0;
        uint64_t connections = 0;
        const auto ours = [&] {
            const uint64_t before = relay.Bytes();
            const uint64_t connections_before = relay.Connections();
            const std::string from = there ? "/there" : "/here";
            const std::string to = there ? "/here" : "/there";
            there = !there;
            const double taken = Milliseconds([&] {
                fs::rename(share + from, share + to);
                Until([&] { return fs::exists(copy + to) && IsIdle(name); });
            });
            most = std::max(most, relay.Bytes() - before);
            connections = std::max(connections, relay.Connections() - connections_before);
            return taken - kGatherMs;
        };
        const std::string what = "a folder of " + std::to_string(files) + " files moved";
        Compare(
            what.c_str(), ours, "a server command", [&] { return Command(); }, kMoves,
            "at most 1.5");
        std::printf("%-34s %9llu bytes in %llu connections at most (wanted: less than 4096)\n",
                    "of these, on the wire", static_cast<unsigned long long>(most),
                    static_cast<unsigned long long>(connections));
        std::fflush(stdout);
        daemon_.Ask("task_remove", name);
        ReachServerAt(port_);
    }

    // One change in a large share and one in a small one; then a restart with nothing changed.
    void Large(int files) {
        Fill("small", kFewFiles);
        Fill("large", files);
        std::this_thread::sleep_for(std::chrono::seconds(1));
        PushOnChange("small", 600);
        const size_t before = ResidentKilobytes();
        RsyncMemory memory;
        const double first = Milliseconds([&] { PushOnChange("large", 3600); });
        memory.Stop();
        std::error_code none;
        uint64_t bytes = 0;
        for (const auto& index : fs::recursive_directory_iterator(
                 root_.Path("client/usr/tarq/etc/zel_daemon/index"), none)) {
            if (index.path().filename() == "large.index") {
                bytes = index.file_size();
            }
        }
        std::printf(
            "%-34s %9.1f s for the first copy, %zu KiB more resident, %.1f bytes a file on disk "
            "(wanted: at most 100)\n",
            (std::to_string(files) + " files").c_str(), first / 1000,
            ResidentKilobytes() - std::min(before, ResidentKilobytes()),
            static_cast<double>(bytes) / files);
        std::printf("%-34s %9llu MiB of the client's rsync, %llu MiB of the server's\n",
                    "meanwhile, at most",
                    static_cast<unsigned long long>(memory.MostOfClients() / 1024),
                    static_cast<unsigned long long>(memory.MostOfServers() / 1024));
        std::fflush(stdout);
        int number = 0;
        const auto change = [&](const std::string& share) {
            return UntilThere(
                root_.Path("storage/" + share) + "/7",
                [&] { root_.Write(share + "/7/7", std::to_string(++number)); }, share);
        };
        Compare(
            "a change in the large share", [&] { return change("large"); },
            "one in a share of 10,000 files", [&] { return change("small"); }, kChanges,
            "at most 1.2");

        const CountingRelay relay(Relayed());
        const uint64_t without = relay.Bytes();
        Command();
        const uint64_t command = relay.Bytes() - without;
        Restart();  // what changed right before was sent so soon that it may have changed again
        std::this_thread::sleep_for(std::chrono::seconds(1));
        Until([&] { return IsSettled("large") && IsSettled("small"); });
        const uint64_t before_start = relay.Bytes();
        const double taken = Milliseconds([&] { Restart(); });
        std::this_thread::sleep_for(std::chrono::seconds(2));
        std::printf(
            "%-34s %9.2f s until all is known again, %llu bytes on the wire, a command has "
            "%llu (wanted: no more)\n",
            "a restart, nothing changed", taken / 1000,
            static_cast<unsigned long long>(relay.Bytes() - before_start),
            static_cast<unsigned long long>(command));
    }

    // 100 tasks each for ten servers, one of which answers a byte now and then: how long the
    // others' take. They are one server under nine addresses, with as many accounts.
    void Fair() {
        const test::TricklingServer slow(port_, AddressOf(0).c_str());
        std::list<CountingRelay> relays;
        for (int server = 1; server < kServers; ++server) {
            relays.emplace_back(std::pair(port_, port_), AddressOf(server));
            Run(root_.Path("server"), {ZEL_SERVER, "account", "add", kUser + std::to_string(server),
                                       "--password-file", password_file_});
        }
        for (int server = 0; server < kServers; ++server) {
            for (int i = 0; i < kTasksEach; ++i) {
                const std::string name = NameOf(server, i);
                root_.Write(name + "/file", "x");
                AddShare(name);
                ZEL::PObject task = TaskOf(name, ZEL::SCHD_MODE_MANUAL, name);
                task["server_ip"] = AddressOf(server);
                task["user"] = kUser + std::to_string(server);
                Must(daemon_.Ask(task)["result"].asInt32() == 0, "no task can be added");
            }
        }
        const auto all_others = [&] {
            return Milliseconds([&] {
                for (int i = 0; i < kTasksEach; ++i) {
                    for (int server = 1; server < kServers; ++server) {
                        daemon_.Ask("task_run", NameOf(server, i));
                    }
                }
                while (!AreOthersDone()) {  // which is no light question
                    std::this_thread::sleep_for(std::chrono::milliseconds(100));
                }
            });
        };
        const auto beside_slow = [&] {
            for (int i = 0; i < kTasksEach; ++i) {
                daemon_.Ask("task_run", NameOf(0, i));
            }
            Must(test::Await([&] { return slow.Clients() != 0; }), "the slow server is not asked");
            const double taken = all_others();
            for (int i = 0; i < kTasksEach; ++i) {
                daemon_.Ask("task_cancel", NameOf(0, i));
            }
            return taken;
        };
        Compare("900 tasks, and 100 of a slow server", beside_slow, "the 900 alone", all_others, 1,
                "at most 1.1");
    }

private:
    static std::string AddressOf(int server) { return "127.0.0." + std::to_string(server + 2); }
    static std::string NameOf(int server, int number) {
        return "fair" + std::to_string(server) + "-" + std::to_string(number);
    }
    // Whether the tasks of all but the slow server are.
    bool AreOthersDone() const {
        ZEL::PObject reply = daemon_.Ask("task_list");
        for (const ZEL::PObject& task : reply["tasks"].asArray()) {
            if (task["name"].asString().find("fair") == 0 &&
                task["server_ip"].asString() != AddressOf(0) &&
                (task["status"].asInt32() != ZEL::TASK_STATUS_IDLE ||
                 task["sync_result"].asInt32() != ZEL::TASK_RESULT_SUCCESS)) {
                return false;
            }
        }
        return true;
    }
    static std::string ScatteredFile(const std::string& share, int number) {
        return share + "/" + std::to_string(number / kFilesEach) + "/" +
               std::to_string(number % kFilesEach);
    }
    void Fill(const std::string& share, int files) {
        for (int i = 0; i < files; ++i) {
            root_.Write(share + "/" + std::to_string(i % kFolders) + "/" + std::to_string(i), "x");
        }
    }
    void PushOnChange(const std::string& share, int seconds) {
        AddShare(share);
        AddTask(share, ZEL::SCHD_MODE_REALTIME, share);
        Must(test::Await([&] { return IsIdle(share); }, seconds), "the first copy was not made");
    }
    // Until all that is to be searched and sent is.
    void Restart() {
        daemon_.End(SIGTERM);
        daemon_.Start();
        Until([&] { return IsSettled("large") && IsSettled("small"); });
    }
    bool IsSettled(const std::string& name) const {
        const ZEL::PObject task = daemon_.Ask("task_show", name)["task"];
        return task["watch_searching"].asInt32() == 0 && task["watch_complete"].asInt32() == 1 &&
               IsIdle(name);
    }
    static void Until(const std::function<bool()>& condition) {
        while (!condition()) {
            std::this_thread::sleep_for(std::chrono::milliseconds(1));
        }
    }
    // From a change until a file has come to the folder of a copy.
    double UntilThere(const std::string& folder, const std::function<void()>& change,
                      const std::string& task) const {
        const base::UniqueFd watch(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
        Must(inotify_add_watch(watch.Get(), folder.c_str(), IN_MOVED_TO) >= 0, "inotify");
        const double taken = Milliseconds([&] {
            change();
            pollfd waiting = {watch.Get(), POLLIN, 0};
            Must(poll(&waiting, 1, 60000) == 1, "the change does not come");
        });
        Must(test::Await([&] { return IsIdle(task); }), "the run does not end");
        return taken - kGatherMs;
    }
    // From now on the client goes through such a port.
    std::pair<int, int> Relayed() {
        relayed_ = test::FreePort();
        ReachServerAt(relayed_);
        return {relayed_, port_};
    }
    // A command that changes nothing, through the relay.
    double Command() {
        const std::string session(32, '0');
        root_.Write("command", "session=\"" + session +
                                   "\"\ncommand=\"ZEL_GetProtocolVer\"\nclientID=\"BENCH\"\n"
                                   "outfile=\"/tmp/x\"\n");
        return Milliseconds([&] {
            Run("", {"rsync", "--port=" + std::to_string(relayed_), "--sockopts=TCP_NODELAY",
                     "--password-file=" + password_file_, "--early-input=" + root_.Path("command"),
                     Server("zel_command/" + session), root_.Path("answer")});
        });
    }

    int relayed_ = 0;
};

}  // namespace

int main(int argc, char** argv) {
    const int large = argc > 1 ? std::atoi(argv[1]) : 200000;
    const std::string only = argc > 2 ? argv[2] : "";
    try {
        Bench bench;
        const auto part = [&](const char* name, const std::function<void()>& measure) {
            if (only.empty() || only == name) {
                measure();
            }
        };
        part("one", [&] { bench.One(); });
        part("scattered", [&] { bench.Scattered(); });
        part("moved", [&] {
            bench.Moved(kFewMoved);
            bench.Moved(large);
        });
        part("fair", [&] { bench.Fair(); });
        part("large", [&] { bench.Large(large); });
    } catch (const std::exception& error) {
        Fail(error.what());
    }
}

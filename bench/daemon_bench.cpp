// What the daemon costs: from a change to the server, with many tasks, with a large tree, at rest.
//
//     cmake --preset bench && cmake --build --preset bench --target daemon_bench
//     build/bench/bin/daemon_bench [FOLDERS]
//
// The daemon, zelctl and the server are the real ones, on loopback. Makes a tree of 100,000
// folders, unless another number is given, below $TMPDIR. Runs alternate with their peers', medians
// are compared; each line ends in the ratio and what is wanted of it.
#include <poll.h>
#include <signal.h>
#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "ZEL/ipc.h"
#include "ZEL/sync_obj.h"
#include "base/child_process.h"
#include "base/unique_fd.h"
#include "bench/large_tree.h"
#include "tests/integration/daemon_process.h"
#include "tests/integration/servers.h"

namespace {

namespace fs = std::filesystem;
using std::chrono::steady_clock;
using test::Request;
using Words = std::vector<std::string>;
using ZEL::PObject;

constexpr int kGatherMs = 10;
constexpr int kTasks = 1000;
constexpr int kChanges = 41;
constexpr int kLists = 41;
constexpr int kStarts = 5;
constexpr int kIdleSeconds = 10;
constexpr char kSearchPath[] = "/usr/local/bin:/usr/bin:/bin";
constexpr char kUser[] = "bob";
constexpr char kPassword[] = "secret";

[[noreturn]] void Fail(const std::string& what) {
    std::fprintf(stderr, "%s\n", what.c_str());
    std::exit(1);
}

void Must(bool done, const std::string& what) {
    if (!done) {
        Fail(what);
    }
}

double Median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + static_cast<long>(values.size() / 2),
                     values.end());
    return values[values.size() / 2];
}

double Milliseconds(const std::function<void()>& work) {
    const auto start = steady_clock::now();
    work();
    return std::chrono::duration<double, std::milli>(steady_clock::now() - start).count();
}

/// Ours and the peer's, in turns; the first of each is not counted.
void Compare(const char* what, const std::function<double()>& ours, const char* peer,
             const std::function<double()>& theirs, int runs, const char* wanted) {
    std::vector<double> our_times;
    std::vector<double> their_times;
    for (int i = -1; i < runs; ++i) {
        const double our_time = ours();
        const double their_time = theirs();
        if (i >= 0) {
            our_times.push_back(our_time);
            their_times.push_back(their_time);
        }
    }
    const auto fastest = [](const std::vector<double>& times) {
        return *std::min_element(times.begin(), times.end());
    };
    std::printf("%-34s %9.2f ms, %-34s %9.2f ms: ratio %.2f (fastest %.2f; wanted: %s)\n", what,
                Median(our_times), peer, Median(their_times),
                Median(our_times) / Median(their_times), fastest(our_times) / fastest(their_times),
                wanted);
    std::fflush(stdout);
}

void Run(const std::string& root, Words command) {
    base::ChildSetup setup;
    setup.program = base::FindProgram(command[0], kSearchPath);
    setup.arguments = command;
    setup.environment = {"LC_ALL=C", "TARQ_ROOT=" + root};
    const auto result = base::RunChild(setup, nullptr, nullptr, nullptr);
    Must(result.start_error == 0 && result.wait_status == 0, command[0] + " failed");
}

/// A number from a file of lines "name: number" in /proc.
uint64_t ProcNumber(const std::string& path, const std::string& name) {
    std::ifstream file(path);
    uint64_t number = 0;
    for (std::string word; file >> word;) {
        if (word == name + ":" && file >> number) {
            break;
        }
    }
    return number;
}

class Bench {
public:
    Bench() : port_(test::FreePort()), daemon_(root_.Path("client"), root_.Path("zel_daemon.log")) {
        password_file_ = root_.Write("password", std::string(kPassword) + "\n");
        chmod(password_file_.c_str(), 0600);
        const std::string server = root_.Path("server");
        Run(server, {ZEL_SERVER, "setup", "--storage", root_.Path("storage"), "--port",
                     std::to_string(port_), "--address", "127.0.0.1"});
        Run(server, {ZEL_SERVER, "account", "add", kUser, "--password-file", password_file_});
        // The peers' modules: nothing of ours is asked there.
        const std::string configuration = server + "/usr/tarq/etc/zel_server";
        const std::string common =
            "\nread only = no\nuse chroot = no\nfake super = yes\nauth users = " +
            std::string(kUser) + "\nsecrets file = " + configuration + "/rsyncd.secrets\n" +
            (geteuid() == 0 ? "uid = 0\ngid = 0\n" : "");
        root_.Write("byte/byte", "x");
        fs::create_directories(root_.Path("plain"));
        root_.Write("server/usr/tarq/etc/zel_server/admin.d/peers.conf",
                    "[byte]\npath = " + root_.Path("byte") + common +
                        "[plain]\npath = " + root_.Path("plain") + common);
        rsyncd_.Start(
            {"rsync", "--daemon", "--no-detach", "--config=" + configuration + "/rsyncd.conf"},
            root_.Path("daemon.log"), port_);
        root_.Write("client/usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
        root_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"BENCH\"\n");
        root_.Write("client/usr/tarq/etc/zel_daemon.conf",
                    "[daemon]\ngather_ms=\"" + std::to_string(kGatherMs) + "\"\n");
        root_.Write("data/first", "x");
        AddShare("data");
        daemon_.Start();
    }

    void Changes() {
        AddTask("changes", ZEL::SCHD_MODE_REALTIME, "data");
        const std::string copy = root_.Path("storage/data");
        Must(test::Await([&] { return fs::exists(copy + "/first") && IsIdle("changes"); }),
             "the first copy was not made");
        const base::UniqueFd watch(inotify_init1(IN_CLOEXEC | IN_NONBLOCK));
        Must(inotify_add_watch(watch.Get(), copy.c_str(), IN_MOVED_TO) >= 0, "inotify");
        int number = 0;
        const auto change = [&] { root_.Write("data/file", std::to_string(++number)); };
        char events[4096];
        const auto ours = [&] {
            while (read(watch.Get(), events, sizeof events) > 0) {  // the peer's change
            }
            const double taken = Milliseconds([&] {
                change();
                pollfd waiting = {watch.Get(), POLLIN, 0};
                Must(poll(&waiting, 1, 60000) == 1, "the change does not come");
            });
            Must(test::Await([&] { return IsIdle("changes"); }), "the run does not end");
            return taken - kGatherMs;
        };
        const auto theirs = [&] {
            change();
            const double taken = Milliseconds([&] {
                BareByte();
                BareByte();
                BareCopy();
                BareByte();
            });
            Must(test::Await([&] { return IsIdle("changes"); }), "the run does not end");
            return taken;
        };
        Compare("a change, until it is there", ours, "rsync of it and three bare commands", theirs,
                kChanges, "at most 1.3");
        daemon_.Ask("task_remove", "changes");
    }

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

    /// Beside a program that does nothing at all.
    void Idle() {
        std::this_thread::sleep_for(std::chrono::seconds(1));
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
        rsyncd_.Stop();  // the daemon has nobody to send the tree to
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
    static PObject TaskOf(const std::string& name, ZEL::SCHD_MODE mode, const std::string& share) {
        PObject task = Request("task_add");
        task["name"] = name;
        task["share_list"].asArray().emplace_back(share);
        task["server_ip"] = "127.0.0.1";
        task["user"] = kUser;
        task["pswd"] = kPassword;
        task["schedule_mode"] = static_cast<int>(mode);
        return task;
    }
    void AddTask(const std::string& name, ZEL::SCHD_MODE mode, const std::string& share) const {
        const PObject reply = daemon_.Ask(TaskOf(name, mode, share));
        Must(reply["result"].asInt32() == 0, reply.toString());
    }
    void AddShare(const std::string& name) const {
        Run(root_.Path("client"), {ZELCTL, "share", "add", name, root_.Path(name)});
    }
    bool IsIdle(const std::string& name) const {
        const PObject task = daemon_.Ask("task_show", name)["task"];
        return task["status"].asInt32() == ZEL::TASK_STATUS_IDLE &&
               task["pending"].asInt32() == 0 &&
               task["sync_result"].asInt32() == ZEL::TASK_RESULT_SUCCESS;
    }
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
    size_t ResidentKilobytes() const { return ProcNumber(ProcFolder() + "/status", "VmRSS"); }
    double CpuMilliseconds() const {
        std::ifstream file(ProcFolder() + "/stat");
        std::string word;
        double ticks = 0;
        for (int i = 1; file >> word && i <= 15; ++i) {
            ticks += i == 14 || i == 15 ? std::stod(word) : 0;
        }
        return ticks * 1000 / static_cast<double>(sysconf(_SC_CLK_TCK));
    }
    std::string ProcFolder() const { return "/proc/" + std::to_string(daemon_.Pid()); }

    void Bare(Words options) const {
        options.insert(options.begin(),
                       {"rsync", "--port=" + std::to_string(port_), "--sockopts=TCP_NODELAY",
                        "--password-file=" + password_file_});
        Run("", std::move(options));
    }
    std::string Server(const std::string& path) const {
        return std::string(kUser) + "@127.0.0.1::" + path;
    }
    void BareByte() const { Bare({Server("byte/byte"), root_.Path("received")}); }
    void BareCopy() const {
        Bare({"-rlptgo", "--modify-window=-1", "-D", "-A", "-X", "--numeric-ids", "--whole-file",
              "--delete-after", "--timeout=600", "--relative", root_.Path("data") + "/./file",
              Server("plain/")});
    }

    test::TempFolder root_;
    int port_;
    test::ServerProcess rsyncd_;
    test::DaemonProcess daemon_;
    std::string password_file_;
};

}  // namespace

int main(int argc, char** argv) {
    try {
        Bench bench;
        bench.Changes();
        bench.List();
        bench.Idle();
        bench.LargeTree(argc > 1 ? std::atoi(argv[1]) : 100000);
    } catch (const std::exception& error) {
        Fail(error.what());
    }
}

// zel_daemon: keeps the tasks of a client, and runs each when it is due.
#include <signal.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstring>
#include <functional>
#include <optional>
#include <set>
#include <thread>
#include <utility>

#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "base/unique_fd.h"
#include "programs/common/failure.h"
#include "programs/common/help.h"
#include "programs/common/host.h"
#include "programs/common/recovery_notes.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/background.h"
#include "programs/zel_daemon/daemon_config.h"
#include "programs/zel_daemon/depositor.h"
#include "programs/zel_daemon/event_loop.h"
#include "programs/zel_daemon/file_watch.h"
#include "programs/zel_daemon/ipc_server.h"
#include "programs/zel_daemon/recovery_watch.h"
#include "programs/zel_daemon/requests.h"
#include "programs/zel_daemon/service.h"
#include "programs/zel_daemon/store.h"
#include "tarq/root_path.h"

namespace {

using namespace zel_daemon;
using programs::Failure;
using programs::FailureKind;
using ZEL::Logger;

constexpr char kStorePath[] = "/usr/tarq/etc/zel_daemon/tasks.db";
constexpr char kSocketPath[] = "/var/run/zel_daemon.sock";
constexpr char kLockPath[] = "/var/run/zel_daemon.lock";
constexpr int kRotatedLogs = 5;
constexpr std::chrono::seconds kLockPatience(2);
constexpr std::chrono::milliseconds kLockStep(10);

struct Options {
    bool foreground = false;
    bool reload = false;
    bool new_store = false;
    bool prepare = false;
    std::string log = "syslog";
    int level = Logger::LEVEL_NOTE;
};

void StartLog(const Options& options) {
    const auto type = options.log == "syslog"   ? Logger::SYSLOG
                      : options.log == "stderr" ? Logger::STDERR
                                                : Logger::LOGFILE;
    if (Logger::Initialize(type, options.level, options.log, kRotatedLogs) != 0) {
        throw programs::SystemFailure("cannot write the log " + options.log);
    }
}

// Two daemons on one store would run every task twice. The lock goes with the process.
base::UniqueFd TakeLock() {
    const std::string path = TARQ::RootPath(kLockPath);
    base::UniqueFd lock(open(path.c_str(), O_CREAT | O_RDWR | O_CLOEXEC, 0600));
    if (!lock) {
        throw programs::SystemFailure("cannot open " + path);
    }
    // The lock of a daemon that was killed goes with the last of its children that had just been
    // made and were no program of their own yet.
    const auto limit = std::chrono::steady_clock::now() + kLockPatience;
    while (flock(lock.Get(), LOCK_EX | LOCK_NB) != 0) {
        if (std::chrono::steady_clock::now() < limit) {
            std::this_thread::sleep_for(kLockStep);
            continue;
        }
        throw Failure("another zel_daemon runs already (it holds " + path + ")");
    }
    return lock;
}

void PrepareFolders() {
    const std::string problem = programs::PrepareHost();
    if (!problem.empty()) {
        throw Failure(problem);
    }
    std::error_code error;
    const std::string run = TARQ::RootPath("/var/run");
    std::filesystem::create_directories(run, error);
    if (error) {
        throw Failure("cannot make " + run + ": " + error.message());
    }
}

// Has the daemon that runs read its configuration again.
void AskToReload() {
    const std::string path = TARQ::RootPath(kSocketPath);
    ZEL::PObject request;
    request["command"] = "reload";
    ZEL::PObject reply;
    ZEL::IPCSender sender;
    if (sender.connect(path) != 0) {
        throw programs::SystemFailure("no daemon answers at " + path);
    }
    if (sender.send(request, true, reply) != 0) {
        throw Failure("the daemon does not answer at " + path);
    }
    if (!reply["error"].asString().empty()) {
        throw Failure(reply["error"].asString());
    }
}

void RenewStore() {
    PrepareFolders();
    const base::UniqueFd lock = TakeLock();
    const std::string path = TARQ::RootPath(kStorePath);
    const std::string aside = Store::Renew(path);
    printf("%s is a new, empty store%s%s\n", path.c_str(),
           aside.empty() ? "" : "; what was there is now ", aside.c_str());
}

// What the configuration of this machine is made of, and the accounts that it goes to.
DepositOrder CollectDeposit(const Service& service, Store& store) {
    DepositOrder order;
    order.taken = store.Deposits();
    const programs::RecoveryNotes recovery;
    std::set<std::pair<std::string, std::string>> accounts;
    for (const TaskRecord* const record : service.Tasks()) {
        order.tasks.push_back(TaskToMap(*record, TaskDetail::kAll));
        const ZEL::SyncInfo& info = record->Info().GetSyncInfo();
        const bool waits = record->paused && recovery.Tasks().count(record->Info().GetName()) != 0;
        order.waits = order.waits || waits;
        if (!info.GetPassword().empty() &&
            accounts.insert({programs::ServerOf(info), info.GetUser()}).second) {
            order.accounts.push_back(info);
        }
    }
    return order;
}

void Serve(const Options& options) {
    std::optional<Background> background;
    if (!options.foreground) {
        background.emplace();
    }
    StartLog(options);
    PrepareFolders();
    const base::UniqueFd lock = TakeLock();
    const DaemonConfig config = ReadDaemonConfig();

    EventLoop loop;
    std::function<std::string()> reload;  // what was wrong
    // Before a thread begins: one that does not block them would take them, and end all.
    loop.OnSignal(SIGHUP, [&] {
        const std::string error = reload();
        if (!error.empty()) {
            Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): %s\n", __LINE__,
                           error.c_str());
        }
    });
    loop.OnSignal(SIGTERM, [&] { loop.Stop(); });
    loop.OnSignal(SIGINT, [&] { loop.Stop(); });
    const std::string store_path = TARQ::RootPath(kStorePath);
    Store store(store_path);
    const SystemClock clock;
    std::optional<IpcServer> server;
    Service service(loop, clock, store, config, [&] {
        if (server) {
            server->Changed();
        }
    });
    Depositor depositor(
        loop, [&] { return CollectDeposit(service, store); },
        [&](const DepositNote& note) { store.NoteDeposit(note); });
    reload = [&] {
        std::string error;
        try {
            service.SetConfig(ReadDaemonConfig());
            Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] zel_daemon(%d): configuration read again\n",
                           __LINE__);
        } catch (const base::ConfigError& wrong) {
            error = std::string(wrong.what()) + "; the configuration stays as it was";
        }
        service.Refresh();
        service.MayHaveRecovered(Recovery::kSettings);
        depositor.Changed();
        return error;
    };
    Requests requests(service, reload, store_path);
    loop.OnClockSet([&] { service.Refresh(); });
    FileWatch zone("/etc", {"localtime"});
    loop.OnReadable(zone.Fd(), [&] {
        if (zone.Changed()) {
            service.Refresh();
        }
    });
    RecoveryWatch recovery;
    loop.OnUrgent(recovery.MountsFd(), [&] { service.MayHaveRecovered(Recovery::kVolume); });
    loop.OnReadable(recovery.NetworkFd(), [&] {
        if (recovery.NetworkChanged()) {
            service.MayHaveRecovered(Recovery::kNetwork);
            depositor.Changed();
        }
    });
    loop.OnReadable(recovery.SettingsFd(), [&] {
        if (recovery.SettingsChanged()) {
            service.MayHaveRecovered(Recovery::kSettings);
            depositor.Changed();
        }
    });
    service.Start();
    depositor.Changed();
    server.emplace(loop, TARQ::RootPath(kSocketPath), config.group,
                   [&](const Peer& peer, const ZEL::PObject& request) {
                       if (Requests::Configures(request)) {
                           depositor.Changed();
                       }
                       return requests.Reply(peer, request);
                   });
    if (background) {
        background->Ready();
    }
    sd_notify(0, "READY=1");
    Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] zel_daemon(%d): ready, %s\n", __LINE__,
                   programs::Count(service.Stats().tasks, "task").c_str());
    loop.Run();
    sd_notify(0, "STOPPING=1");
    Logger::LogMsg(Logger::LEVEL_NOTE, "[NOTE] zel_daemon(%d): stopping\n", __LINE__);
    server.reset();
}

// Whether standard error goes to the journal, as the system's log does.
bool IsJournal() {
    struct stat error = {};
    const char* const stream = getenv("JOURNAL_STREAM");  // "device:inode"
    return stream != nullptr && fstat(STDERR_FILENO, &error) == 0 &&
           stream == std::to_string(error.st_dev) + ":" + std::to_string(error.st_ino);
}

// To the person who started it and to the log, but once where both are the same.
void Say(const Options& options, const std::exception& error) {
    if (options.log != "stderr" && !(options.log == "syslog" && IsJournal())) {
        fprintf(stderr, "zel_daemon: %s\n", error.what());
    }
    Logger::LogMsg(Logger::LEVEL_ERROR, "[ERROR] zel_daemon(%d): %s\n", __LINE__, error.what());
}

// kLocal: starting it again would not help, only a person can.
void Act(const Options& options) {
    FailureKind kind = FailureKind::kFailed;
    try {
        if (options.new_store) {
            RenewStore();
        } else if (options.prepare) {
            StartLog(options);
            PrepareFolders();
        } else {
            Serve(options);
        }
        return;
    } catch (const base::ConfigError& error) {
        kind = FailureKind::kLocal;
        Say(options, error);
    } catch (const Failure& error) {
        kind = error.Kind();
        Say(options, error);
    } catch (const std::exception& error) {
        Say(options, error);
    }
    throw programs::ReportedFailure(kind);
}

}  // namespace

int main(int argc, char** argv) {
    CLI::App app{"Keeps the sync tasks of this machine, and runs each when it is due"};
    app.name("zel_daemon");
    programs::SpeakPlainly(app, false);
    app.set_version_flag("--version", ZEL_VERSION, "Show the version");
    Options options;
    app.add_flag("--foreground", options.foreground, "Stay in the foreground");
    app.add_flag("--reload", options.reload,
                 "Have the running daemon read its configuration again, and tell if it is wrong");
    app.add_flag(
        "--new-store", options.new_store,
        "Begin with an empty store, when the one there was is lost, and end; what is there "
        "is moved away");
    app.add_flag(
        "--prepare", options.prepare,
        "Only make the folders that it needs; the system's unit does so first, with rights "
        "that the daemon has not");
    app.add_option("--log", options.log, "syslog, stderr, or a file's path")
        ->option_text("WHERE")
        ->capture_default_str();
    app.add_option("--log-level", options.level, "error, warning, note, info or debug")
        ->transform(programs::OneOf({{"error", Logger::LEVEL_ERROR},
                                     {"warning", Logger::LEVEL_WARNING},
                                     {"note", Logger::LEVEL_NOTE},
                                     {"info", Logger::LEVEL_INFO},
                                     {"debug", Logger::LEVEL_DEBUG}}))
        ->default_str("note");
    app.callback([&] { options.reload ? AskToReload() : Act(options); });
    return programs::RunReporting(
        "zel_daemon", [&] { programs::Parse(app, programs::CommandWords(argc, argv)); });
}

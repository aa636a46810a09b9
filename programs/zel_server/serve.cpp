#include "programs/zel_server/serve.h"

#include <sys/stat.h>
#include <sys/wait.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

#include "base/child_process.h"
#include "base/file_lock.h"
#include "programs/common/failure.h"
#include "programs/zel_server/acceptor.h"
#include "programs/zel_server/front.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/rsyncd_config.h"
#include "programs/zel_server/share_record.h"
#include "programs/zel_server/take_storage.h"

namespace zel_server {

namespace {

using programs::Failure;
using programs::SystemFailure;

// Files that the daemon writes are readable by its own user and group only.
constexpr mode_t kUmask = 0027;

// Creates a folder, or corrects its owner, its group and its mode.
void HaveFolder(const std::string& path, mode_t mode, gid_t group) {
    struct stat info = {};
    if (mkdir(path.c_str(), 0700) != 0 && errno != EEXIST) {
        throw SystemFailure("cannot make " + path);
    }
    if (lstat(path.c_str(), &info) != 0 || !S_ISDIR(info.st_mode) || info.st_uid != geteuid()) {
        throw Failure(path + " is not this user's own folder: remove it");
    }
    if (chown(path.c_str(), geteuid(), group) != 0 || chmod(path.c_str(), mode) != 0) {
        throw SystemFailure("cannot set owner and mode of " + path);
    }
}

// Takes the lock that only one server per configuration can hold, until the process ends. Throws
// Failure when another one runs.
base::FileLock TakeTurn() {
    base::FileLock lock(AnswerFolder() + "/.serving", std::chrono::milliseconds(0));
    if (!lock) {
        throw Failure(errno == EWOULDBLOCK
                          ? "this server is served already: 'zel_server status' says by which "
                            "process"
                          : lock.Problem());
    }
    return lock;
}

pid_t StartFront(const ServerConfig& config) {
    const std::vector<std::string> command = PrepareFront(config);
    const std::vector<char*> arguments = base::ArgumentVector(command);
    const pid_t parent = getpid();
    const pid_t child = fork();
    if (child < 0) {
        throw SystemFailure("cannot start the front");
    }
    if (child == 0) {
        base::ResetSignals();
        // The front receives SIGTERM when this process ends for whatever reason.
        if (base::EndWithParent(parent)) {
            execv(arguments[0], arguments.data());
            perror("zel_server: haproxy cannot be run");
        }
        _exit(127);
    }
    return child;
}

// Acceptor reads these signals from a signalfd.
void BlockSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    for (const int number : {SIGCHLD, SIGTERM, SIGINT}) {
        sigaddset(&signals, number);
    }
    sigprocmask(SIG_BLOCK, &signals, nullptr);
    signal(SIGPIPE, SIG_IGN);
}

// Migrates the module files of earlier versions. Their folder is removed later, once rsyncd.conf no
// longer refers to it.
void TakeOverShares() {
    const RegistryLock lock;
    if (!lock.Held() || !TakeOverOldModules()) {
        throw SystemFailure("cannot write the records of shares in " + ShareRecords());
    }
}

}  // namespace

void Serve(bool with_front) {
    // Reported as kUsage, so that the service manager does not restart it in vain.
    ServerConfig config = RequireServerConfig(programs::FailureKind::kUsage);
    RequireClosedStorage(config);
    const uid_t front_user = FrontUser();
    umask(kUmask);
    HaveFolder(AnswerFolder(), 0700, getegid());
    HaveFolder(OpenModules(), 0700, getegid());
    HaveFolder(FrontFolder(), 0750, FrontGroup());
    const base::FileLock turn = TakeTurn();
    TakeOverShares();
    std::error_code ignored;
    std::filesystem::remove_all(ConnectionConfigs(),
                                ignored);  // a process that was killed left some
    if (!WriteRsyncdConfig(config)) {
        throw SystemFailure("cannot write the configuration in " + ConfigFolder());
    }
    rmdir(OldShareModules().c_str());
    // rsync treats module names as equal when they differ only in letter case or blanks, by the
    // rules of the locale. A fixed locale keeps ModuleKey() in agreement with it.
    setenv("LC_ALL", "C", 1);
    BlockSignals();
    Acceptor acceptor(front_user);
    const pid_t front = with_front ? StartFront(config) : 0;
    sd_notify(0, "READY=1");
    const std::optional<int> status = acceptor.Run(front);
    sd_notify(0, "STOPPING=1");
    if (status) {
        throw Failure("the front has ended " +
                      (WIFSIGNALED(*status)
                           ? "by signal " + std::to_string(WTERMSIG(*status))
                           : "with status " + std::to_string(WEXITSTATUS(*status))));
    }
    if (front != 0) {
        kill(front, SIGTERM);
        waitpid(front, nullptr, 0);
    }
}

void RunFront() {
    const std::vector<std::string> command =
        PrepareFront(RequireServerConfig(programs::FailureKind::kUsage));
    const std::vector<char*> arguments = base::ArgumentVector(command);
    execv(arguments[0], arguments.data());
    throw SystemFailure("cannot run " + command[0]);
}

}  // namespace zel_server

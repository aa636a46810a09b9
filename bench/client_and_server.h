// A daemon and a server on loopback, and a plain rsync daemon as their peer.
#pragma once

#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <utility>
#include <vector>

#include "ZEL/sync_obj.h"
#include "base/child_process.h"
#include "tests/integration/daemon_process.h"
#include "tests/integration/servers.h"

namespace bench {

using Words = std::vector<std::string>;

constexpr int kGatherMs = 10;
constexpr char kUser[] = "bob";
constexpr char kPassword[] = "secret words";

[[noreturn]] inline void Fail(const std::string& what) {
    std::fprintf(stderr, "%s\n", what.c_str());
    std::exit(1);
}

inline void Must(bool done, const std::string& what) {
    if (!done) {
        Fail(what);
    }
}

inline void Run(const std::string& root, Words command) {
    base::ChildSetup setup;
    setup.program = base::FindProgram(command[0], test::kSearchPath);
    setup.arguments = command;
    setup.environment = {"LC_ALL=C", "TARQ_ROOT=" + root};
    const auto result = base::RunChild(setup, nullptr, nullptr, nullptr);
    Must(result.start_error == 0 && result.wait_status == 0, command[0] + " failed");
}

/// A number from a file of lines "name: number" in /proc.
inline uint64_t ProcNumber(const std::string& path, const std::string& name) {
    std::ifstream file(path);
    uint64_t number = 0;
    for (std::string word; file >> word;) {
        if (word == name + ":" && file >> number) {
            break;
        }
    }
    return number;
}

/// The client has the share "data", with a file "first".
class ClientAndServer {
protected:
    ClientAndServer()
        : port_(test::FreePort()),
          peer_port_(test::FreePort()),
          daemon_(root_.Path("client"), root_.Path("zel_daemon.log")) {
        password_file_ = root_.Write("password", std::string(kPassword) + "\n");
        chmod(password_file_.c_str(), 0600);
        const std::string server = root_.Path("server");
        Run(server, {ZEL_SERVER, "setup", "--storage", root_.Path("storage"), "--plain-port",
                     std::to_string(port_), "--port", std::to_string(test::FreePort()), "--address",
                     "127.0.0.1"});
        Run(server, {ZEL_SERVER, "account", "add", kUser, "--password-file", password_file_});
        // The peers' modules, of a daemon of their own: nothing of ours is asked there.
        const std::string configuration = server + "/usr/tarq/etc/zel_server";
        const std::string common =
            "\nread only = no\nuse chroot = no\nfake super = yes\nauth users = " +
            std::string(kUser) + "\nsecrets file = " + configuration + "/rsyncd.secrets\n" +
            (geteuid() == 0 ? "uid = 0\ngid = 0\n" : "");
        root_.Write("byte/byte", "x");
        std::filesystem::create_directories(root_.Path("plain"));
        const std::string peers = root_.Write(
            "peers.conf", "socket options = TCP_NODELAY\nreverse lookup = no\n[byte]\npath = " +
                              root_.Path("byte") + common +
                              "[plain]\npath = " + root_.Path("plain") + common);
        peer_.Start({"rsync", "--daemon", "--no-detach", "--config=" + peers,
                     "--port=" + std::to_string(peer_port_), "--address=127.0.0.1"},
                    root_.Path("peer.log"), peer_port_);
        server_.Start({"env", "TARQ_ROOT=" + server, ZEL_SERVER, "serve"}, root_.Path("server.log"),
                      port_);
        ReachServerAt(port_);
        root_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"BENCH\"\n");
        root_.Write("client/usr/tarq/etc/zel_daemon.conf",
                    "[daemon]\ngather_ms=\"" + std::to_string(kGatherMs) + "\"\n");
        root_.Write("data/first", "x");
        AddShare("data");
        daemon_.Start();
    }

    static ZEL::PObject TaskOf(const std::string& name, ZEL::SCHD_MODE mode,
                               const std::string& share) {
        ZEL::PObject task = test::Request("task_add");
        task["name"] = name;
        task["share_list"].asArray().emplace_back(share);
        task["server_ip"] = "127.0.0.1";
        task["user"] = kUser;
        task["pswd"] = kPassword;
        task["schedule_mode"] = static_cast<int>(mode);
        return task;
    }
    void AddTask(const std::string& name, ZEL::SCHD_MODE mode, const std::string& share) const {
        const ZEL::PObject reply = daemon_.Ask(TaskOf(name, mode, share));
        Must(reply["result"].asInt32() == 0, reply.toString());
    }
    void AddShare(const std::string& name) const {
        Run(root_.Path("client"), {ZELCTL, "share", "add", name, root_.Path(name)});
    }
    bool IsIdle(const std::string& name) const {
        const ZEL::PObject task = daemon_.Ask("task_show", name)["task"];
        return task["status"].asInt32() == ZEL::TASK_STATUS_IDLE &&
               task["pending"].asInt32() == 0 &&
               task["sync_result"].asInt32() == ZEL::TASK_RESULT_SUCCESS;
    }
    size_t ResidentKilobytes() const { return ProcNumber(ProcFolder() + "/status", "VmRSS"); }
    std::string ProcFolder() const { return "/proc/" + std::to_string(daemon_.Pid()); }

    void Bare(Words options) const {
        options.insert(options.begin(),
                       {"rsync", "--port=" + std::to_string(peer_port_), "--sockopts=TCP_NODELAY",
                        "--password-file=" + password_file_});
        Run("", std::move(options));
    }
    std::string Server(const std::string& path) const {
        return std::string(kUser) + "@127.0.0.1::" + path;
    }
    void BareByte() const { Bare({Server("byte/byte"), root_.Path("received")}); }

    /// From the next connection on.
    void ReachServerAt(int port) {
        root_.Write("client/usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(port) + "\"\n");
    }

    test::TempFolder root_;
    int port_;
    int peer_port_;
    test::ServerProcess server_;
    test::ServerProcess peer_;
    test::DaemonProcess daemon_;
    std::string password_file_;
};

}  // namespace bench

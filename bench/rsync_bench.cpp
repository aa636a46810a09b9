// What the wrapper costs beside bare rsync, over a daemon of its own on loopback.
//
//   rsync_bench [--copies | --encrypted | --versions [restored | unchanged | replaced]]
//
// The server is a real one, `zel_server serve` with its front; the peers have a plain rsync daemon,
// or an ssh server.
// --copies: also the large copies, which write 2 GB below $TMPDIR; in memory (/dev/shm) a disk's
// moods stay out of it. --encrypted: of those the ones over TLS and ssh, and nothing else.
// --versions: what it costs to keep what is replaced, and a restore by `zelctl restore`; all of it
// or one part. Runs alternate, medians are compared; each line ends in the ratio and the ratio that
// is wanted.
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <functional>
#include <list>
#include <string>
#include <vector>

#include "base/child_process.h"
#include "tarq/rsync_servers.h"
#include "tarq/rsync_wrapper.h"
#include "tests/integration/servers.h"

namespace {

namespace fs = std::filesystem;
using Words = std::vector<std::string>;

constexpr int kCommandRuns = 101;
constexpr int kCopyRuns = 9;
// Writing many small files takes longer at some times than at others.
constexpr int kManyFilesRuns = 31;
constexpr int kCrowd = 10000;  // shares of a server

/// One way to do the job: prepares, unmeasured, then runs.
struct Contestant {
    std::function<void()> prepare;
    std::function<bool()> run;
    std::vector<double> seconds = {};
    std::vector<double> cpu_seconds = {};  // of this process and the programs that it ran
};

double CpuSeconds() {
    double sum = 0;
    for (const int who : {RUSAGE_SELF, RUSAGE_CHILDREN}) {
        rusage usage;
        getrusage(who, &usage);
        for (const timeval& time : {usage.ru_utime, usage.ru_stime}) {
            sum += static_cast<double>(time.tv_sec) + static_cast<double>(time.tv_usec) * 1e-6;
        }
    }
    return sum;
}

double Fastest(const std::vector<double>& values) {
    return *std::min_element(values.begin(), values.end());
}

double Median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + static_cast<long>(values.size() / 2),
                     values.end());
    return values[values.size() / 2];
}

void Measure(std::vector<Contestant*> contestants, int runs) {
    for (int i = -1; i < runs; ++i) {  // the first is not counted
        for (Contestant* contestant : contestants) {
            if (contestant->prepare) {
                contestant->prepare();
            }
            const double cpu_start = CpuSeconds();
            const auto start = std::chrono::steady_clock::now();
            if (!contestant->run()) {
                std::fprintf(stderr, "a run failed\n");
                std::exit(1);
            }
            const std::chrono::duration<double> taken = std::chrono::steady_clock::now() - start;
            if (i >= 0) {
                contestant->seconds.push_back(taken.count());
                contestant->cpu_seconds.push_back(CpuSeconds() - cpu_start);
            }
        }
        std::rotate(contestants.begin(), contestants.begin() + 1, contestants.end());
    }
}

// `wanted`: the largest ratio that is right; 0: there is none.
void Print(const char* what, const Contestant& ours, const char* peer, const Contestant& theirs,
           double wanted) {
    const double our_median = Median(ours.seconds);
    const double their_median = Median(theirs.seconds);
    std::printf("%-20s %9.2f ms, %-28s %9.2f ms: ratio %.3f (", what, our_median * 1e3, peer,
                their_median * 1e3, our_median / their_median);
    if (wanted > 0) {
        std::printf("wanted: at most %.2f; ", wanted);
    }
    std::printf("fastest runs %.3f, CPU time %.3f)\n",
                Fastest(ours.seconds) / Fastest(theirs.seconds),
                Median(ours.cpu_seconds) / Median(theirs.cpu_seconds));
    std::fflush(stdout);
}

constexpr char kUser[] = "bob";
constexpr char kPassword[] = "secret words";
constexpr char kShare[] = "data";
constexpr char kOurs[] = "--filter=- /.zel_*";       // the server's own folders in the copy
constexpr char kQuick[] = "--sockopts=TCP_NODELAY";  // as the wrapper's runs have it
// The same server by three names, each with a way of its own.
constexpr char kPlain[] = "plain";
constexpr char kTls[] = "tls";
constexpr char kSsh[] = "ssh";

class Bench {
public:
    Bench() : port_(test::FreePort()), tls_port_(test::FreePort()), peer_port_(test::FreePort()) {
        password_file_ = root_.Write("password", std::string(kPassword) + "\n");
        chmod(password_file_.c_str(), 0600);
        root_.Write("usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
        ZelServer({"setup", "--storage", root_.Path("storage"), "--plain-port",
                   std::to_string(port_), "--port", std::to_string(tls_port_), "--address",
                   "127.0.0.1"});
        ZelServer({"account", "add", kUser, "--password-file", password_file_});
        // The peers' modules, of a daemon of their own: nothing of ours is asked there. Copies go
        // to the folder that the share has, too: two folders of one disk are not equally fast.
        const std::string common =
            "\nread only = no\nfake super = yes\nauth users = " + std::string(kUser) +
            "\nsecrets file = " + root_.Path("server/usr/tarq/etc/zel_server/rsyncd.secrets") +
            "\n" + (geteuid() == 0 ? "use chroot = yes\nuid = 0\ngid = 0\n" : "use chroot = no\n");
        root_.Write("byte/byte", "x");
        const std::string peers = root_.Write(
            "peers.conf", "socket options = TCP_NODELAY\nreverse lookup = no\n[byte]\npath = " +
                              root_.Path("byte") + common + "[plain]\npath = " + copy_ + common);
        peer_.Start({"rsync", "--daemon", "--no-detach", "--config=" + peers,
                     "--port=" + std::to_string(peer_port_), "--address=127.0.0.1"},
                    root_.Path("peer.log"), peer_port_);
        server_.Start({"env", "TARQ_ROOT=" + root_.Path("server"), ZEL_SERVER, "serve"},
                      root_.Path("server.log"), port_);
        using namespace TARQ::Backup;
        TrustServer(
            {kTls, ServerTransport::TLS, tls_port_, FetchFingerprint("127.0.0.1", tls_port_, 10)});
        Must(Command({"command=\"ZEL_PairingMultiSrc\"", "clientID=\"BENCH\"",
                      "serverName=\"bench\"", "syncShares=\"data\"", "dryRun=\"no\"",
                      "outfile=\"\"", "requireEncryptionShareSupport=\"no\""}));
        Must(StartShare());
    }

    void Commands() {
        Contestant wrapper = {nullptr, [this] { return WrapperCommand(); }};
        Contestant plain = {nullptr, [this] { return BareByte({}); }};
        Contestant quick = {nullptr, [this] { return BareByte({"--sockopts=TCP_NODELAY"}); }};
        Contestant tls = {nullptr, [this] { return WrapperCommand(kTls); }};
        Measure({&wrapper, &plain, &quick, &tls}, kCommandRuns);
        Print("command over TLS", tls, "the same without TLS", wrapper, 1.5);
        Print("server command", wrapper, "rsync, one byte", plain, 0.35);
        Print("server command", wrapper, "rsync TCP_NODELAY, one byte", quick, 1.2);
    }

    // What a command costs a server that has as many shares as one ever has.
    void Crowd() {
        RegisterShares(kCrowd);
        const auto compare = [this](const char* what, const std::function<bool()>& command) {
            Contestant crowded = {[this] { Have(true); }, command};
            Contestant alone = {[this] { Have(false); }, command};
            Measure({&crowded, &alone}, kCommandRuns);
            Print(what, crowded, "the same beside one share", alone, 1.2);
        };
        compare("10,000: version", [this] { return WrapperCommand(); });
        compare("10,000: start", StartShare);
        compare("10,000: beacon", [] {
            return Command(
                {"command=\"ZEL_UpdateTaskStatus\"", "clientID=\"BENCH\"", "taskName=\"bench\""});
        });
    }

    void Unchanged() {
        const std::string source = root_.Path("small");
        Fill(source, 100, 1000);
        Contestant wrapper = {nullptr, [&] { return WrapperCopy(source); }};
        Contestant plain = {nullptr, [&] { return BareCopy(source, {}); }};
        Contestant quick = {nullptr, [&] { return BareCopy(source, {"--sockopts=TCP_NODELAY"}); }};
        Measure({&wrapper, &plain, &quick}, kCommandRuns);
        Print("100 unchanged files", wrapper, "rsync", plain, 0.5);
        // The peer's server asks nobody whether it may be written to.
        Print("100 unchanged files", wrapper, "rsync TCP_NODELAY", quick, 0);
    }

    void Copies() {
        Copy("20,000 files of 4 KB", "many", 20000, 4096);
        Copy("1 GB in 8 files", "large", 8, 128 << 20);
        Encrypted();
    }

    // Where nothing changed, and what is brought back, is a tree of such a size that the files cost
    // and not the commands around the run, which are measured by themselves.
    void Versions(const std::string& part) {
        if (part.empty() || part == "restored") {
            Restored(100000);
        }
        if (part.empty() || part == "unchanged") {
            NothingChanged(200000);
        }
        if (part.empty() || part == "replaced") {
            Replaced(20000);
        }
    }

    void NothingChanged(int count) {
        const std::string source = root_.Path("kept");
        Fill(source, count, 64);
        Contestant wrapper = {nullptr, [&] { return WrapperCopy(source); }};
        Contestant bare = {nullptr, [&] { return BareCopy(source, {kQuick, kOurs}); }};
        Measure({&wrapper, &bare}, kCopyRuns);
        Print("200,000 unchanged", wrapper, "rsync", bare, 1.02);
        EmptyCopy();
        fs::remove_all(source);
    }

    void Replaced(int count) {
        const std::string source = root_.Path("replaced");
        int turn = 0;
        const auto replace = [&] {
            fs::remove_all(root_.Path("storage/.versions"));
            fs::remove_all(copy_ + "/kept-by-rsync");
            Fill(source, count, 4096 + static_cast<size_t>(++turn));
            sync();
        };
        Contestant replaced = {replace, [&] { return WrapperCopy(source); }};
        Contestant backup = {replace, [&] {
                                 return BareCopy(source,
                                                 {kQuick, "--backup", "--backup-dir=/kept-by-rsync",
                                                  "--filter=P /kept-by-rsync", kOurs});
                             }};
        Measure({&replaced, &backup}, kManyFilesRuns);
        Print("20,000 replaced", replaced, "rsync --backup", backup, 1.15);
        fs::remove_all(source);
    }

    void Restored(int count) {
        const std::string source = root_.Path("kept");
        Fill(source, count, 4096);
        Must(WrapperCopy(source));
        fs::remove_all(source);
        Must(Command({"command=\"ZEL_SyncFinish\"", "clientID=\"BENCH\"", "finishType=\"share\"",
                      "name=\"data\""}));
        const std::string back = root_.Path("back");
        const auto empty = [&] {
            fs::remove_all(back);
            sync();
        };
        Contestant restore = {empty, [&] {
                                  return RunProgram(
                                      ZELCTL, {"restore", "--quiet", "--share", kShare, "--server",
                                               "127.0.0.1", "--user", kUser, "--plain",
                                               "--password-file", password_file_, "--to", back});
                              }};
        Contestant pull = {empty, [&] {
                               return Bare(
                                   {kQuick, "-rlptgoD", "--modify-window=-1", "-A", "-X",
                                    "--numeric-ids", "--whole-file", "--timeout=600", kOurs},
                                   {Server("plain/"), back + "/"});
                           }};
        Measure({&restore, &pull}, kCopyRuns);
        Print("100,000 restored", restore, "rsync, the same options", pull, 1.1);
        Must(StartShare());
        EmptyCopy();
        empty();
    }

    void Encrypted() {
        if (!test::SshServer::Available()) {
            std::puts("1 GB over TLS: this machine cannot run an ssh server to compare with");
            return;
        }
        using namespace TARQ::Backup;
        const test::SshServer ssh;
        root_.Write("usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(port_) + "\"\nssh_options=\"-F none -l " +
                        ssh.User() + " -i " + ssh.ClientKey() + "\"\n");
        const SshHostKey key = FetchHostKey("127.0.0.1", ssh.Port(), "", 10);
        TrustServer({kSsh, ServerTransport::SSH, ssh.Port(), key.fingerprint}, key);
        const std::string source = root_.Path("encrypted");
        Fill(source, 8, 128 << 20);
        const auto empty = [this] { EmptyCopy(); };
        Contestant tls = {empty, [&] { return WrapperCopy(source, kTls); }};
        Contestant over_ssh = {empty, [&] { return WrapperCopy(source, kSsh); }};
        Measure({&tls, &over_ssh}, kCopyRuns);
        Print("1 GB over TLS", tls, "the same over ssh", over_ssh, 1.0);
        fs::remove_all(source);
    }

private:
    void EmptyCopy() const {
        for (const auto& entry : fs::directory_iterator(copy_)) {
            fs::remove_all(entry);
        }
        sync();
    }

    void Copy(const char* what, const std::string& name, int count, size_t size) {
        const std::string source = root_.Path(name);
        Fill(source, count, size);
        const auto empty = [this] { EmptyCopy(); };
        Contestant wrapper = {empty, [&] { return WrapperCopy(source); }};
        Contestant quick = {empty, [&] { return BareCopy(source, {"--sockopts=TCP_NODELAY"}); }};
        Measure({&wrapper, &quick}, kCopyRuns);
        Print(what, wrapper, "rsync, the same options", quick, 1.03);
        fs::remove_all(source);
        empty();
    }

    static void Fill(const std::string& folder, int count, size_t size) {
        for (int i = 0; i < count; ++i) {
            const std::string parent = folder + "/" + std::to_string(i % 200);
            fs::create_directories(parent);
            std::string content(size, 'x');
            content.replace(0, 8, std::to_string(10000000 + i));
            std::ofstream(parent + "/" + std::to_string(i), std::ios::binary) << content;
        }
    }

    static void Must(bool done) {
        if (!done) {
            std::fprintf(stderr, "the server cannot be set up\n");
            std::exit(1);
        }
    }

    void ZelServer(Words arguments) const {
        arguments.insert(arguments.begin(), ZEL_SERVER);
        base::ChildSetup setup;
        setup.program = ZEL_SERVER;
        setup.arguments = std::move(arguments);
        setup.environment = {"LC_ALL=C", "TARQ_ROOT=" + root_.Path("server")};
        const auto result = base::RunChild(setup, nullptr, nullptr, nullptr);
        Must(result.start_error == 0 && result.wait_status == 0);
    }

    /// One of ours, as the client.
    bool RunProgram(const char* program, Words arguments) const {
        arguments.insert(arguments.begin(), program);
        base::ChildSetup setup;
        setup.program = program;
        setup.arguments = std::move(arguments);
        setup.environment = {"LC_ALL=C", "PATH=/usr/local/bin:/usr/bin:/bin",
                             "TARQ_ROOT=" + root_.Path("")};
        const auto result = base::RunChild(setup, nullptr, nullptr, nullptr);
        return result.start_error == 0 && result.wait_status == 0;
    }

    static void Prepare(TARQ::Backup::RsyncWrapper& wrapper, const std::string& module) {
        wrapper.setDelete(true);
        wrapper.setNumericIds(true);
        wrapper.setTarqAuth(true, true);
        wrapper.setTarqPseudoRoot(true);
        wrapper.setTimeout(600);
        wrapper.setDestPath(kUser, "127.0.0.1", kPassword, module, "");
    }

    // A second registry and second records, for Have(): those that are there and `count` more like
    // kShare's.
    void RegisterShares(int count) const {
        const std::string registry = test::ReadFile(etc_ + "tarqZEL.info");
        const std::string section = registry.substr(registry.find("[SHARE_data]"));
        const std::string record = test::ReadFile(etc_ + "zel_server/shares/data");
        fs::create_directories(etc_ + "zel_server/shares.other");
        fs::copy(etc_ + "zel_server/shares/data", etc_ + "zel_server/shares.other/data");
        std::ofstream more(etc_ + "tarqZEL.info.other");
        more << registry;
        for (int i = 0; i < count; ++i) {
            const std::string name = "data" + std::to_string(i);
            more << Renamed(section.substr(0, section.find("\n[") + 1), name);
            std::ofstream(etc_ + "zel_server/shares.other/" + name) << Renamed(record, name);
        }
    }

    // Puts the crowd of shares, or the one, in its place.
    void Have(bool crowd) {
        if (crowd == has_crowd_) {
            return;
        }
        has_crowd_ = crowd;
        for (const std::string& path : {etc_ + "tarqZEL.info", etc_ + "zel_server/shares"}) {
            fs::rename(path, path + ".aside");
            fs::rename(path + ".other", path);
            fs::rename(path + ".aside", path + ".other");
        }
    }

    static std::string Renamed(std::string text, const std::string& name) {
        const std::string old = kShare;
        for (size_t at = 0; (at = text.find(old, at)) != std::string::npos; at += name.size()) {
            text.replace(at, old.size(), name);
        }
        return text;
    }

    static bool StartShare() {
        return Command({"command=\"ZEL_SyncStart\"", "clientID=\"BENCH\"", "volumeName=\"\"",
                        "shareName=\"data\""});
    }

    static void Name(TARQ::Backup::RsyncWrapper& wrapper, const char* server) {
        TARQ::Backup::RunOptions options;
        options.server = server;
        options.keep_versions = true;  // the server takes no push without
        wrapper.setRunOptions(options);
    }

    static bool Command(const std::list<std::string>& lines, const char* server = kPlain) {
        TARQ::Backup::RsyncWrapper wrapper;
        Prepare(wrapper, "");
        Name(wrapper, server);
        wrapper.setTarqCustCmdRule(lines);
        return wrapper.execute([] { return false; }) == 0;
    }

    bool WrapperCommand(const char* server = kPlain) const {
        return Command({"command=\"ZEL_GetProtocolVer\"", "clientID=\"BENCH\"",
                        "outfile=\"" + root_.Path("tmp/ZEL/out") + "\""},
                       server);
    }

    bool WrapperCopy(const std::string& source, const char* server = kPlain) const {
        TARQ::Backup::RsyncWrapper wrapper;
        Prepare(wrapper, kShare);
        Name(wrapper, server);
        wrapper.setTarqAcl(true);
        wrapper.setSrcPath(source + "/");
        return wrapper.execute([] { return false; }) == 0;
    }

    bool BareByte(const Words& options) const {
        return Bare(options, {Server("byte/byte"), root_.Path("tmp/byte")});
    }

    bool BareCopy(const std::string& source, Words options) const {
        options.insert(options.end(),
                       {"-rlptgo", "--modify-window=-1", "-D", "-A", "-X", "--numeric-ids",
                        "--whole-file", "--delete-after", "--timeout=600"});
        return Bare(options, {source + "/", Server("plain/")});
    }

    std::string Server(const std::string& path) const {
        return std::string(kUser) + "@127.0.0.1::" + path;
    }

    bool Bare(const Words& options, const Words& paths) const {
        base::ChildSetup setup;
        setup.program = base::FindProgram("rsync", "/usr/local/bin:/usr/bin:/bin");
        setup.arguments = {"rsync", "--port=" + std::to_string(peer_port_),
                           "--password-file=" + password_file_};
        setup.arguments.insert(setup.arguments.end(), options.begin(), options.end());
        setup.arguments.insert(setup.arguments.end(), paths.begin(), paths.end());
        setup.environment = {"LC_ALL=C"};
        const auto result = base::RunChild(setup, nullptr, nullptr, nullptr);
        return result.start_error == 0 && result.wait_status == 0;
    }

    test::TempRoot root_;
    const std::string copy_ = root_.Path("storage/data");
    const std::string etc_ = root_.Path("server/usr/tarq/etc/");
    bool has_crowd_ = false;
    int port_;
    int tls_port_;
    int peer_port_;
    test::ServerProcess server_;
    test::ServerProcess peer_;
    std::string password_file_;
};

}  // namespace

int main(int argc, char** argv) {
    Bench bench;
    if (argc > 1 && std::strcmp(argv[1], "--encrypted") == 0) {
        bench.Encrypted();
        return 0;
    }
    if (argc > 1 && std::strcmp(argv[1], "--versions") == 0) {
        bench.Versions(argc > 2 ? argv[2] : "");
        return 0;
    }
    bench.Commands();
    bench.Unchanged();
    if (argc > 1 && std::strcmp(argv[1], "--copies") == 0) {
        bench.Copies();
    }
    bench.Crowd();
}

// What the wrapper costs beside bare rsync, over a daemon of its own on loopback.
//
//   rsync_bench [--copies]
//
// The server is a real one: zel_server's configuration, handler and admission on an rsync daemon.
// --copies: also the two large copies, which write 2 GB below $TMPDIR; in memory (/dev/shm) a
// disk's moods stay out of it. Runs alternate, medians are compared; each line ends in the ratio
// and the ratio that is wanted.
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
#include "tarq/rsync_wrapper.h"
#include "tests/integration/servers.h"

namespace {

namespace fs = std::filesystem;
using Words = std::vector<std::string>;

constexpr int kCommandRuns = 101;
constexpr int kCopyRuns = 9;

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
constexpr char kPassword[] = "secret";
constexpr char kShare[] = "data";

class Bench {
public:
    Bench() : port_(test::FreePort()) {
        password_file_ = root_.Write("password", std::string(kPassword) + "\n");
        chmod(password_file_.c_str(), 0600);
        root_.Write("usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
        ZelServer({"setup", "--storage", root_.Path("storage"), "--port", std::to_string(port_),
                   "--address", "127.0.0.1"});
        ZelServer({"account", "add", kUser, "--password-file", password_file_});
        // The peers' modules: nothing of ours is asked there. Copies go to the folder that the
        // share has, too: two folders of one disk are not equally fast.
        const std::string configuration = root_.Path("server/usr/tarq/etc/zel_server");
        const std::string common =
            "\nread only = no\nuse chroot = no\nfake super = yes\nauth users = " +
            std::string(kUser) + "\nsecrets file = " + configuration + "/rsyncd.secrets\n" +
            (geteuid() == 0 ? "uid = 0\ngid = 0\n" : "");
        root_.Write("byte/byte", "x");
        root_.Write(
            "server/usr/tarq/etc/zel_server/admin.d/peers.conf",
            "[byte]\npath = " + root_.Path("byte") + common + "[plain]\npath = " + copy_ + common);
        daemon_.Start(
            {"rsync", "--daemon", "--no-detach", "--config=" + configuration + "/rsyncd.conf"},
            root_.Path("daemon.log"), port_);
        Must(Command({"command=\"ZEL_PairingMultiSrc\"", "clientID=\"BENCH\"",
                      "serverName=\"bench\"", "syncShares=\"data\"", "dryRun=\"no\"",
                      "outfile=\"\"", "requireEncryptionShareSupport=\"no\""}));
        Must(Command({"command=\"ZEL_SyncStart\"", "clientID=\"BENCH\"", "volumeName=\"\"",
                      "shareName=\"data\""}));
    }

    void Commands() {
        Contestant wrapper = {nullptr, [this] { return WrapperCommand(); }};
        Contestant plain = {nullptr, [this] { return BareByte({}); }};
        Contestant quick = {nullptr, [this] { return BareByte({"--sockopts=TCP_NODELAY"}); }};
        Measure({&wrapper, &plain, &quick}, kCommandRuns);
        Print("server command", wrapper, "rsync, one byte", plain, 0.35);
        Print("server command", wrapper, "rsync TCP_NODELAY, one byte", quick, 1.2);
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
    }

private:
    void Copy(const char* what, const std::string& name, int count, size_t size) {
        const std::string source = root_.Path(name);
        Fill(source, count, size);
        const auto empty = [this] {
            fs::remove_all(copy_);
            fs::create_directories(copy_);
            sync();
        };
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

    static void Prepare(TARQ::Backup::RsyncWrapper& wrapper, const std::string& module) {
        wrapper.setDelete(true);
        wrapper.setNumericIds(true);
        wrapper.setTarqAuth(true, true);
        wrapper.setTarqPseudoRoot(true);
        wrapper.setTimeout(600);
        wrapper.setDestPath(kUser, "127.0.0.1", kPassword, module, "");
    }

    static bool Command(const std::list<std::string>& lines) {
        TARQ::Backup::RsyncWrapper wrapper;
        Prepare(wrapper, "");
        wrapper.setTarqCustCmdRule(lines);
        return wrapper.execute([] { return false; }) == 0;
    }

    bool WrapperCommand() const {
        return Command({"command=\"ZEL_GetProtocolVer\"", "clientID=\"BENCH\"",
                        "outfile=\"" + root_.Path("tmp/ZEL/out") + "\""});
    }

    bool WrapperCopy(const std::string& source) const {
        TARQ::Backup::RsyncWrapper wrapper;
        Prepare(wrapper, kShare);
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
        setup.arguments = {"rsync", "--port=" + std::to_string(port_),
                           "--password-file=" + password_file_};
        setup.arguments.insert(setup.arguments.end(), options.begin(), options.end());
        setup.arguments.insert(setup.arguments.end(), paths.begin(), paths.end());
        setup.environment = {"LC_ALL=C"};
        const auto result = base::RunChild(setup, nullptr, nullptr, nullptr);
        return result.start_error == 0 && result.wait_status == 0;
    }

    test::TempRoot root_;
    const std::string copy_ = root_.Path("storage/data");
    int port_;
    test::ServerProcess daemon_;
    std::string password_file_;
};

}  // namespace

int main(int argc, char** argv) {
    Bench bench;
    bench.Commands();
    bench.Unchanged();
    if (argc > 1 && std::strcmp(argv[1], "--copies") == 0) {
        bench.Copies();
    }
}

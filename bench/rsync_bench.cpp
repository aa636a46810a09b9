// What the wrapper costs beside bare rsync, over a daemon of its own on loopback.
//
//   rsync_bench [COMMAND_HANDLER] [--copies]
//
// COMMAND_HANDLER: the program (with arguments) that answers commands, as for the daemon's `early
// exec`; by default this program itself, which answers at once. --copies: also the two large
// copies, which write 2 GB below $TMPDIR. Runs alternate and medians are compared; a busy machine
// distorts them, so each line gives the ratios of the fastest runs and of processor time as well.
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
#include <iostream>
#include <string>
#include <vector>

#include "platform/internal/child_process.h"
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

void Print(const char* what, const Contestant& ours, const char* peer, const Contestant& theirs,
           double wanted) {
    const double our_median = Median(ours.seconds);
    const double their_median = Median(theirs.seconds);
    std::printf(
        "%-20s %9.2f ms, %-28s %9.2f ms: ratio %.3f (wanted: at most %.2f; fastest runs %.3f, CPU "
        "time %.3f)\n",
        what, our_median * 1e3, peer, their_median * 1e3, our_median / their_median, wanted,
        Fastest(ours.seconds) / Fastest(theirs.seconds),
        Median(ours.cpu_seconds) / Median(theirs.cpu_seconds));
    std::fflush(stdout);
}

class Bench {
public:
    explicit Bench(const std::string& handler) {
        daemon_.AddCommandModule(handler);
        std::ofstream(daemon_.AddModule("byte") + "/byte") << "x";
        module_ = daemon_.AddModule("data", "fake super = yes");
        password_file_ = root_.Write("password", std::string(test::RsyncDaemon::kPassword) + "\n");
        chmod(password_file_.c_str(), 0600);
        root_.Write("usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(daemon_.Port()) + "\"\n");
    }

    void Commands() {
        Contestant wrapper = {nullptr, [this] { return WrapperCommand(); }};
        Contestant plain = {nullptr, [this] { return BareByte({}); }};
        Contestant quick = {nullptr, [this] { return BareByte({"--sockopts=TCP_NODELAY"}); }};
        Contestant same = {nullptr, [this] { return BareCommand(); }};
        Measure({&wrapper, &plain, &quick, &same}, kCommandRuns);
        Print("server command", wrapper, "rsync, the same command", same, 1.05);
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
        Print("100 unchanged files", wrapper, "rsync TCP_NODELAY", quick, 1.2);
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
            fs::remove_all(module_);
            fs::create_directories(module_);
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

    void Prepare(TARQ::Backup::RsyncWrapper& wrapper, const std::string& module) const {
        wrapper.setDelete(true);
        wrapper.setNumericIds(true);
        wrapper.setTarqAuth(true, true);
        wrapper.setTarqPseudoRoot(true);
        wrapper.setTimeout(600);
        wrapper.setDestPath(test::RsyncDaemon::kUser, "127.0.0.1", test::RsyncDaemon::kPassword,
                            module, "");
    }

    bool WrapperCommand() const {
        TARQ::Backup::RsyncWrapper wrapper;
        Prepare(wrapper, "");
        wrapper.setTarqCustCmdRule({"command=\"ZEL_GetProtocolVer\"",
                                    "clientID=\"00:11:22:33:44:55\"",
                                    "outfile=\"" + root_.Path("tmp/ZEL/out") + "\""});
        return wrapper.execute([] { return false; }) == 0;
    }

    bool WrapperCopy(const std::string& source) const {
        TARQ::Backup::RsyncWrapper wrapper;
        Prepare(wrapper, "data");
        wrapper.setTarqAcl(true);
        wrapper.setSrcPath(source + "/");
        return wrapper.execute([] { return false; }) == 0;
    }

    bool BareByte(const Words& options) const {
        return Bare(options, {Server("byte/byte"), root_.Path("tmp/byte")});
    }

    bool BareCommand() const {
        const std::string command = root_.Path("tmp/command");
        std::ofstream(command) << "session=\"0\"\ncommand=\"ZEL_GetProtocolVer\"\n";
        return Bare({"--sockopts=TCP_NODELAY", "--early-input=" + command},
                    {Server("zel_command/0"), root_.Path("tmp/answer")});
    }

    bool BareCopy(const std::string& source, Words options) const {
        options.insert(options.end(), {"-rlptgo", "-D", "-A", "-X", "--numeric-ids", "--whole-file",
                                       "--delete-after", "--timeout=600"});
        return Bare(options, {source + "/", Server("data/")});
    }

    std::string Server(const std::string& path) const {
        return std::string(test::RsyncDaemon::kUser) + "@127.0.0.1::" + path;
    }

    bool Bare(const Words& options, const Words& paths) const {
        tarq_internal::ChildSpec spec;
        spec.program = tarq_internal::FindProgram("rsync", "/usr/local/bin:/usr/bin:/bin");
        spec.arguments = {"rsync", "--port=" + std::to_string(daemon_.Port()),
                          "--password-file=" + password_file_};
        spec.arguments.insert(spec.arguments.end(), options.begin(), options.end());
        spec.arguments.insert(spec.arguments.end(), paths.begin(), paths.end());
        spec.environment = {"LC_ALL=C"};
        const auto result = tarq_internal::RunChild(spec, nullptr, nullptr, nullptr);
        return result.start_error == 0 && result.wait_status == 0;
    }

    test::TempRoot root_;
    test::RsyncDaemon daemon_;
    std::string module_;
    std::string password_file_;
};

/// The stand-in for a server's command handler.
int AnswerCommand() {
    std::string word;
    std::getline(std::cin, word, '"');
    std::string session;
    std::getline(std::cin, session, '"');
    std::ofstream(std::string(std::getenv("ANSWERS")) + "/" + session) << "status=\"0\"\n1\n";
    return 0;
}

}  // namespace

int main(int argc, char** argv) {
    std::string handler = fs::read_symlink("/proc/self/exe").string() + " --answer-command";
    bool copies = false;
    for (int i = 1; i < argc; ++i) {
        if (std::strcmp(argv[i], "--answer-command") == 0) {
            return AnswerCommand();
        }
        if (std::strcmp(argv[i], "--copies") == 0) {
            copies = true;
        } else {
            handler = argv[i];
        }
    }
    Bench bench(handler);
    bench.Commands();
    bench.Unchanged();
    if (copies) {
        bench.Copies();
    }
}

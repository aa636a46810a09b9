#include "tarq/rsync_wrapper.h"

#include <arpa/inet.h>
#include <dirent.h>
#include <sys/socket.h>

#include "base/unique_fd.h"
#include "tarq/rsync_servers.h"
#include "tests/integration/servers.h"
#include "tests/support/syslog_capture.h"
#include "tests/support/testing.h"

namespace {

using namespace TARQ::Backup;
using namespace testing;

using test::ReadFile;
using Set = std::function<void(RsyncWrapper&)>;
using Cancelled = std::function<bool()>;

/// Command lines and environments of all processes but this one.
std::string OtherProcesses() {
    std::string text;
    for (const auto& entry : fs::directory_iterator("/proc")) {
        const std::string proc = entry.path();
        if (proc != "/proc/" + std::to_string(getpid())) {
            text += ReadFile(proc + "/cmdline") + ReadFile(proc + "/environ");
        }
    }
    return text;
}

/// A plain answer: a failure shall not print the environment of all that runs.
bool Has(const std::string& text, const std::string& words) {
    return text.find(words) != std::string::npos;
}

/// A client with a root folder of its own, beside a daemon with the module "data".
class RsyncWrapperTest : public testing::Test {
protected:
    RsyncWrapperTest() {
        module_ = daemon_.AddModule("data");
        Configure();
    }

    /// The client's configuration file: the daemon's port, then `lines`.
    void Configure(const std::string& lines = "") {
        root_.Write("usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(daemon_.Port()) + "\"\n" + lines);
    }

    std::string Script(const std::string& name, const std::string& text) const {
        chmod(root_.Write(name, "#!/bin/sh\n" + text).c_str(), 0755);
        return root_.Path(name);
    }
    void ServeCommands(const std::string& script) {
        daemon_.AddCommandModule(Script("handler", script));
    }

    /// Copies the source to the module, with what `set` says beside.
    int Copy(const Set& set = {}, RunOptions options = {}, const Cancelled& cancelled = nullptr) {
        RsyncWrapper wrapper;
        wrapper.setTarqAuth(true, true);
        wrapper.setDestPath(test::RsyncDaemon::kUser, "127.0.0.1", kPassword, "data", "");
        wrapper.setSrcPath(Source());
        wrapper.setDelete(true);
        if (set) {
            set(wrapper);
        }
        report_ = RunReport();
        options.report = &report_;
        wrapper.setRunOptions(options);
        const int status = wrapper.execute(cancelled);
        wrapper.logError();
        return status;
    }
    int Command(const std::list<std::string>& lines, const Cancelled& cancelled = nullptr) {
        const auto command = [&](RsyncWrapper& wrapper) {
            wrapper.setListOnly(true);
            wrapper.setDebugLog(true);
            wrapper.setTarqCustCmdRule(lines);
        };
        return Copy(command, {}, cancelled);
    }

    std::string Source(const std::string& name = "") const { return root_.Path("share/" + name); }
    void AddToSource(const std::string& name, const std::string& content = "") {
        root_.Write("share/" + name, content);
    }
    void EmptyModule() const {
        fs::remove_all(module_);
        fs::create_directories(module_);
    }
    void AddToModule(const std::string& name) {
        fs::create_directories(fs::path(module_ + "/" + name).parent_path());
        std::ofstream(module_ + "/" + name) << "old";
    }

    static std::set<std::string> Tree(const std::string& folder) {
        std::set<std::string> names;
        for (const auto& entry : fs::recursive_directory_iterator(folder)) {
            names.insert(entry.path().lexically_relative(folder));
        }
        return names;
    }

    void ExpectNothingLeft() const {
        EXPECT_THAT(Tree(root_.Path("tmp")), ElementsAre("ZEL"));
        EXPECT_FALSE(Has(OtherProcesses(), "--early-input=" + root_.Path()));
    }

    static constexpr const char* kPassword = test::RsyncDaemon::kPassword;
    test::TempRoot root_;
    test::RsyncDaemon daemon_;
    std::string module_;
    RunReport report_;
};

constexpr char kEchoHandler[] =
    "tee \"$ANSWERS/../../received\" | {\n"
    "  IFS='\"' read -r _ session _\n"
    "  { printf 'status=\"214\"\n\\000one\\ntwo'; } > \"$ANSWERS/$session\"\n"
    "  cat > /dev/null; }\n";

TEST_F(RsyncWrapperTest, ACommandUpToTheLimitReachesTheHandlerAndItsAnswerTheOutfile) {
    ServeCommands(kEchoHandler);
    const std::string outfile = root_.Write("tmp/ZEL/out", "longer than the answer will be");
    fs::create_hard_link(outfile, root_.Path("same"));
    EXPECT_EQ(Command({"command=\"X\"", "outfile=\"" + outfile + "\"", "last=\"1\""}), 214);
    EXPECT_EQ(ReadFile(root_.Path("same")), std::string("\0one\ntwo", 8));
    EXPECT_THAT(ReadFile(daemon_.Folder("received")),
                testing::ContainsRegex("^session=\"[0-9a-f]{32}\"\ncommand=\"X\"\n"
                                       "outfile=\"[^\n]*\"\nlast=\"1\"\n$"));
    EXPECT_THAT(Tree(root_.Path("tmp")), ElementsAre("ZEL", "ZEL/out"));

    fs::remove(daemon_.Folder("received"));
    const size_t session_line = 9 + 32 + 2;
    const std::string fits(kMaxCommandBytes - session_line - 1, 'x');
    EXPECT_EQ(Command({fits + "x"}), STATUS_COMMAND_TOO_LONG);
    EXPECT_FALSE(fs::exists(daemon_.Folder("received")));
    EXPECT_EQ(Command({fits}), 214);
    EXPECT_EQ(ReadFile(daemon_.Folder("received")).size(), kMaxCommandBytes);

    fs::create_symlink(root_.Write("elsewhere", "kept"), root_.Path("link"));
    for (const char* unwritable : {"none/out", "link"}) {
        EXPECT_EQ(Command({"outfile=\"" + root_.Path(unwritable) + "\""}), 11);
        EXPECT_THAT(report_.explanation, HasSubstr("cannot be written to " + root_.Path()));
    }
    EXPECT_EQ(ReadFile(root_.Path("elsewhere")), "kept");
}

TEST_F(RsyncWrapperTest, HostileAnswersAreFailuresAndLeaveTheOutfileAlone) {
    const std::string outfile = root_.Write("tmp/ZEL/out", "before");
    ServeCommands(
        "IFS='\"' read -r _ session _; IFS='\"' read -r _ kind _; cd \"$ANSWERS\"\n"
        "case $kind in\n"
        "link) ln -s /etc/passwd $session;;\n"
        "fifo) mkfifo $session;;\n"
        "folder) mkdir $session; echo 'status=\"0\"' > $session/$session;;\n"
        "large) { echo 'status=\"0\"'; head -c 17000000 /dev/zero; } > $session;;\n"
        "none) ;;\n"
        "crash) exit 3;;\n"
        "*) printf '%b' \"$kind\" > $session;;\n"
        "esac\n");
    for (const auto& [kind, status, words] :
         std::initializer_list<std::tuple<std::string, int, const char*>>{
             {"link", 12, "no file"},
             {"fifo", 12, "no file"},
             {"folder", 12, "no file"},
             {"large", 12, "larger than"},
             {"none", 23, "left no answer"},
             {"crash", 5, "the program that takes commands"},
             {"status=0\\n", 12, "does not begin with a status"},
         }) {
        EXPECT_EQ(Command({"kind=\"" + kind + "\"", "outfile=\"" + outfile + "\""}), status)
            << kind;
        EXPECT_THAT(report_.explanation, HasSubstr(words));
        EXPECT_EQ(ReadFile(outfile), "before") << kind;
    }
    EXPECT_THAT(Tree(root_.Path("tmp")), ElementsAre("ZEL", "ZEL/out"));
}

TEST_F(RsyncWrapperTest, FailuresHaveTheirStatusAndSayInPlainWordsWhatIsWrong) {
    AddToSource("file");
    const auto to = [](const std::string& user, const std::string& host,
                       const std::string& password, const std::string& module,
                       const std::string& sub = "") {
        return [=](RsyncWrapper& w) { w.setDestPath(user, host, password, module, sub); };
    };
    const auto command = [](const std::string& line) {
        return [=](RsyncWrapper& w) { w.setTarqCustCmdRule({line}); };
    };
    const std::string home = "127.0.0.1";
    for (const auto& [status, words, set] :
         std::initializer_list<std::tuple<int, std::string, Set>>{
             {5, "wrong account or password", to("bob", home, "x", "data")},
             {5, "none is set", to("bob", home, "", "data")},
             {5, "no module 'nope'", to("bob", home, kPassword, "nope")},
             {10, "host name no.such.invalid", to("bob", "no.such.invalid", kPassword, "data")},
             {43, "takes no server commands", command("command=\"X\"")},
             {1, "line break", command("command=\"X\"\nb=\"\"")},
             {10, "is its rsync daemon", [](auto& w) { w.setPort(test::FreePort()); }},
             {3, "does not exist", [](auto& w) { w.setSrcPath("/no/such"); }},
             {1, "neither a host", to("bob", "-oProxyCommand=x", kPassword, "data")},
             {1, "account name", to("-x", home, kPassword, "data")},
             {1, "cannot be one", to("bob", home, kPassword, "-x")},
             {1, "'..'", to("bob", home, kPassword, "data", "a/../../b")},
         }) {
        SCOPED_TRACE(words);
        test::TakeSyslog();
        EXPECT_EQ(Copy(set), status);
        EXPECT_THAT(report_.explanation, AllOf(HasSubstr(words), Not(HasSubstr(kPassword))));
        EXPECT_THAT(test::TakeSyslogTexts(), Contains(HasSubstr(words)));
        EXPECT_EQ(report_.cause == RunCause::UNKNOWN_MODULE,
                  Has(report_.details, "Unknown module"));
    }
    EXPECT_THAT(Tree(module_), IsEmpty());
}

TEST_F(RsyncWrapperTest, AServerThatSaysNothingIsGivenUpAndASlowCopyIsNot) {
    const base::UniqueFd silent(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    const int port = test::FreePort();
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(static_cast<uint16_t>(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    ASSERT_EQ(bind(silent.Get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(listen(silent.Get(), 1), 0);
    Configure("answer_seconds=\"2\"\ndead_seconds=\"2\"\n");
    AddToSource("file", std::string(4000000, 'x'));
    const auto begin = std::chrono::steady_clock::now();
    const auto to_silent = [=](RsyncWrapper& w) { w.setPort(port); };
    EXPECT_EQ(Copy(to_silent), STATUS_TIMEOUT);
    EXPECT_THAT(report_.explanation, HasSubstr("said nothing for 2 seconds"));
    ServeCommands("cat > /dev/null; sleep 20");
    EXPECT_EQ(Command({"command=\"X\""}), STATUS_TIMEOUT);
    EXPECT_THAT(report_.explanation, HasSubstr("did not answer the command"));
    const int trickling_port = test::FreePort();
    const test::TricklingServer trickling(trickling_port);
    const auto to_trickling = [=](RsyncWrapper& w) {
        w.setPort(trickling_port);
        w.setTarqCustCmdRule({"command=\"X\""});
    };
    EXPECT_EQ(Copy(to_trickling), STATUS_TIMEOUT) << "each byte would be one more second";
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(15));

    RunOptions slow;
    slow.bandwidth_limit = 800;
    EXPECT_EQ(Copy({}, slow), 0) << report_.explanation;
}

TEST_F(RsyncWrapperTest, ProgressOfAnUpdateIsOfFilesAndOfAFirstCopyIsOfBytes) {
    for (int i = 0; i < 50; ++i) {
        AddToSource("in_step/" + std::to_string(i), "x");
    }
    chmod(module_.c_str(), 0700);
    std::vector<RunProgress> seen;
    RunOptions options;
    options.bandwidth_limit = 2000;
    options.on_progress = [&](const RunProgress& progress) { seen.push_back(progress); };
    for (const auto basis : {RunProgress::BYTES, RunProgress::FILES}) {
        for (const char* large : {"in_step/large", "large"}) {
            AddToSource(large, std::string(1000000 + basis, 'x'));
        }
        seen.clear();
        EXPECT_EQ(Copy({}, options), 0);
        EXPECT_EQ(seen.back().percent, 100U);
        EXPECT_EQ(seen.back().files_checked, 54U);
        unsigned int largest = 0;
        for (const RunProgress& progress : seen) {
            largest = std::max(largest, progress.percent);
            EXPECT_TRUE(progress.percent < 100 || progress.bytes_done >= 2000000);
            EXPECT_TRUE(progress.bytes_done == 0 || progress.percent_of == basis);
            EXPECT_LE(progress.file_bytes, progress.file_length);
        }
        EXPECT_TRUE(std::any_of(seen.begin(), seen.end(), [](const RunProgress& progress) {
            return progress.file == "in_step/large" && progress.file_length >= 1000000;
        }));
    }
}

TEST_F(RsyncWrapperTest, ARunShowsItsPasswordNowhereAndEndsWithinASecondOfItsCancel) {
    ServeCommands("cat > /dev/null; sleep 20");
    // A program that does not mind being asked to end, with a child of its own.
    const std::string asleep = "54321." + std::to_string(getpid());
    const std::string deaf =
        Script("deaf", "trap '' TERM\nsleep " + asleep + " & sleep " + asleep + "\n");
    for (const std::string& program : {deaf, std::string("rsync")}) {
        SCOPED_TRACE(program);
        Configure("rsync=\"" + program + "\"\n");
        std::string seen;
        std::chrono::steady_clock::time_point asked;
        const auto look = [&] {
            seen += OtherProcesses();
            for (const std::string& name : Tree(root_.Path("tmp"))) {
                const std::string path = root_.Path("tmp/" + name);
                if (fs::is_regular_file(path)) {
                    EXPECT_EQ(test::ModeOf(path) & 077, 0U) << name;
                    seen += ReadFile(path);
                }
            }
            return std::chrono::steady_clock::now() > asked;
        };
        const auto ends_soon = [&] {
            asked = std::chrono::steady_clock::now() + std::chrono::milliseconds(300);
            EXPECT_EQ(Command({"command=\"X\""}, look), 20);
            return std::chrono::steady_clock::now() - asked < std::chrono::seconds(1);
        };
        EXPECT_TRUE(ends_soon() || ends_soon() || ends_soon()) << "on a busy machine one of three";
        EXPECT_EQ(report_.explanation, "the run was cancelled");
        seen += ReadFile(root_.Path("var/log/tarqrsync.log"));
        EXPECT_TRUE(Has(seen, "--early-input=" + root_.Path()) && Has(seen, "session="));
        EXPECT_FALSE(Has(seen, kPassword));
        ExpectNothingLeft();
        EXPECT_FALSE(Has(OtherProcesses(), asleep));
    }
}

TEST_F(RsyncWrapperTest, ACopyMirrorsContentAttributesAndDeletions) {
    AddToSource("a/file", "content");
    for (const char* name :
         {"-dash", "new\nline", "wild*[card]?$(x) 'q' \"d\" \\#012", "\xff\xfe broken"}) {
        AddToSource(name);
    }
    fs::create_symlink("a/file", Source("link"));
    mkfifo(Source("fifo").c_str(), 0600);
    chmod(Source("a/file").c_str(), 0641);
    AddToModule("gone/deep/file");

    EXPECT_EQ(Copy([](auto& w) { w.setTarqPseudoRoot(true); }), 0);
    EXPECT_EQ(Tree(module_), Tree(Source()));
    EXPECT_EQ(fs::read_symlink(module_ + "/link").filename(), "file");
    EXPECT_EQ(test::ModeOf(module_ + "/a/file"), 0641U);
    EXPECT_EQ(fs::last_write_time(module_ + "/a/file"), fs::last_write_time(Source("a/file")));
    EXPECT_EQ(report_.files_deleted, 3U);
    EXPECT_EQ(report_.explanation, "");

    AddToModule("kept");
    EXPECT_EQ(Copy([](auto& w) { w.setDelete(false); }), 0);
    std::vector<std::string> listed;
    RunOptions options;
    options.on_change = [&](const RunChange& c) {
        listed.push_back(std::to_string(c.kind) + " " + std::to_string(c.length) + " " + c.path);
    };
    EXPECT_EQ(Copy([](auto& w) { w.setListOnly(true); }, options), 0);
    EXPECT_THAT(listed, IsSupersetOf({"0 0 new\nline", "0 7 a/file", "0 3 kept", "2 0 ./"}));
}

TEST_F(RsyncWrapperTest, ARelativeSubTreeDeletesNothingOutsideOfIt) {
    AddToSource("docs/a/file");
    AddToSource("docs/other");
    for (const char* name : {"keep", "docs/keep", "docs/a/gone", "docs/b/keep"}) {
        AddToModule(name);
    }
    chmod(Source("docs").c_str(), 0751);
    const auto relative = [&](RsyncWrapper& w) {
        w.setSrcPath(Source("./docs/a"));
        w.setRelativePath(true);
    };
    EXPECT_EQ(Copy(relative), 0);
    EXPECT_THAT(Tree(module_), UnorderedElementsAre("keep", "docs", "docs/keep", "docs/a",
                                                    "docs/a/file", "docs/b", "docs/b/keep"));
    EXPECT_EQ(test::ModeOf(module_ + "/docs"), 0751U);
}

TEST_F(RsyncWrapperTest, ExcludeRulesAreTakenAsTheyStandAndProtectTheDestination) {
    const std::list<std::string> rules = {"#recycle", "+ x",   ";c",       "!",
                                          "- y",      "*.tmp", "new\nline"};
    for (const char* name : {"#recycle", "+ x", ";c", "!", "- y", "a.tmp", "new\nline", "copied"}) {
        AddToSource(name);
    }
    std::list<std::string> many = rules;
    many.resize(4000, "too many to be arguments");
    for (const auto& list : {rules, many}) {
        EmptyModule();
        AddToModule("protected.tmp");
        EXPECT_EQ(Copy([&](auto& w) { w.setExcludeRule(list); }), 0);
        EXPECT_THAT(Tree(module_), UnorderedElementsAre("copied", "protected.tmp"));
    }
}

TEST_F(RsyncWrapperTest, ASourceThatCannotBeReadInFullDeletesNothing) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root to give rsync fewer rights than the test has";
    }
    chmod(root_.Path().c_str(), 0755);
    Configure("rsync=\"" +
              Script("weak", "exec setpriv --reuid=65534 --clear-groups rsync \"$@\"\n") + "\"\n");
    AddToSource("aaa/file");
    AddToSource("zzz/file");
    AddToModule("aaa/gone");
    AddToModule("zzz/gone");
    for (const char* locked : {"zzz", "zzz/file"}) {
        SCOPED_TRACE(locked);
        chmod(Source(locked).c_str(), 0);
        EXPECT_EQ(Copy(), 23);
        EXPECT_THAT(report_.explanation,
                    AllOf(HasSubstr("source cannot be read"), HasSubstr("nothing was deleted"),
                          HasSubstr(locked)));
        EXPECT_THAT(Tree(module_), IsSupersetOf({"aaa/gone", "zzz/gone"}));
        chmod(Source(locked).c_str(), 0755);
    }
    EXPECT_EQ(Copy(), 0);
    EXPECT_EQ(Tree(module_), Tree(Source()));
}

TEST_F(RsyncWrapperTest, AFarEndWithoutAclsOrAttributesGetsTheFilesWithoutThem) {
    AddToSource("file", "content");
    const std::string plain = daemon_.AddModule("plain", "refuse options = acls xattrs");
    const auto with_acls = [](RsyncWrapper& w) {
        w.setTarqAcl(true);
        w.setDestPath("bob", "127.0.0.1", kPassword, "plain", "");
    };
    EXPECT_EQ(Copy(with_acls), 0);
    EXPECT_EQ(ReadFile(plain + "/file"), "content");
    EXPECT_THAT(test::TakeSyslogTexts(),
                Contains(HasSubstr("cannot keep the access control lists")));
}

TEST_F(RsyncWrapperTest, AKilledPushNeverLeavesHalfAFileUnderItsNameAndTheNextOneCompletes) {
    std::string content(4U << 20, '\0');
    std::generate(content.begin(), content.end(), std::mt19937());
    AddToSource("large", content);
    for (const bool delta : {false, true}) {
        SCOPED_TRACE(delta);
        EmptyModule();
        RunOptions slow;
        slow.bandwidth_limit = 1024;
        uint64_t done = 0;
        slow.on_progress = [&](const RunProgress& p) { done = p.bytes_done; };
        const auto set = [&](RsyncWrapper& w) { w.setDeltaCopy(delta); };
        EXPECT_EQ(Copy(set, slow, [&] { return done > 1U << 19; }), 20);
        EXPECT_FALSE(fs::exists(module_ + "/large"));
        // The daemon notices the broken connection by itself; what it keeps of the file it has in
        // hand lies apart.
        for (int i = 0; delta && i < 200 && !fs::exists(module_ + "/.tarqrsync-partial/large");
             ++i) {
            usleep(10000);
        }
        EXPECT_EQ(Copy(set), 0);
        EXPECT_EQ(ReadFile(module_ + "/large"), content);
        EXPECT_THAT(Tree(module_), UnorderedElementsAre("large"));
        EXPECT_EQ(report_.bytes_total, content.size());
        EXPECT_EQ(report_.bytes_sent < content.size(), delta);
    }
}

TEST_F(RsyncWrapperTest, AnRsyncThatIsMissingOrTooOldIsNamed) {
    AddToSource("file");
    Configure("rsync=\"no-such-rsync\"\n");
    EXPECT_EQ(Copy(), 127);
    EXPECT_EQ(report_.explanation, "the program no-such-rsync is not installed");
    const std::string old = Script(
        "old",
        "[ \"$1\" = --version ] && { echo 'rsync  version 3.1.3  protocol version 31'; exit; }\n"
        "echo 'rsync: --early-input=x: unknown option' >&2; exit 1\n");
    Configure("rsync=\"" + old + "\"\n");
    EXPECT_EQ(Command({"command=\"X\""}), 1);
    EXPECT_THAT(report_.explanation, StartsWith(old + " is rsync 3.1.3, which is too old"));
    root_.Write("usr/tarq/etc/tarqrsync.conf", "[rsync]\nport=\"many\"\n");
    EXPECT_EQ(Copy(), 1);
    EXPECT_THAT(report_.explanation, HasSubstr("port is 'many', not a number from 1 to 65535"));
}

TEST_F(RsyncWrapperTest, TheDebugLogIsRotatedAndAFolderWithoutRightsIsNoFailure) {
    AddToSource("file");
    const auto logged = [](RsyncWrapper& w) { w.setDebugLog(true); };
    const std::string log = root_.Write("var/log/tarqrsync.log", std::string(1024 * 1024, 'x'));
    EXPECT_EQ(Copy(logged), 0);
    EXPECT_LT(fs::file_size(log), 4096U);
    EXPECT_EQ(fs::file_size(log + ".1"), 1024U * 1024);
    EXPECT_THAT(ReadFile(log), Not(HasSubstr("file\n")));
    fs::remove_all(root_.Path("var/log"));
    EXPECT_EQ(Copy(logged), 0);
}

/// The same client and daemon, with a TLS proxy in front of the daemon.
class RsyncWrapperTlsTest : public RsyncWrapperTest {
protected:
    RsyncWrapperTlsTest() { Trust(); }

    void Trust(const std::string& host = "nas") {
        TrustServer({host, ServerTransport::TLS, front_.Port(), front_.Fingerprint()});
    }
    /// Settings of a person's that the file of servers overrules.
    int CopyTo(const std::string& address, RunOptions options = {},
               const Cancelled& cancelled = nullptr) {
        options.server = "NAS";
        const auto set = [&](RsyncWrapper& wrapper) {
            wrapper.setSsh(true);
            wrapper.setPort(test::FreePort());
            wrapper.setDestPath(test::RsyncDaemon::kUser, address, kPassword, "data", "");
        };
        return Copy(set, options, cancelled);
    }

    test::TlsFront front_{daemon_.Port()};
};

TEST_F(RsyncWrapperTlsTest, TheServerWithTheTrustedKeyIsPushedToAndNoOther) {
    AddToSource("file", std::string(3000000, 'x'));
    ASSERT_EQ(CopyTo("127.0.0.1"), 0) << report_.explanation << report_.details;
    EXPECT_EQ(fs::file_size(module_ + "/file"), 3000000U);
    AddToSource("second", "2");
    EXPECT_EQ(CopyTo("::1"), 0) << report_.explanation;
    EXPECT_EQ(ReadFile(module_ + "/second"), "2");

    // What answers with another key gets not a byte of rsync's, neither there nor behind it.
    const std::string trusted = front_.Fingerprint();
    const size_t logged = daemon_.Log().size();
    front_.ChangeKey();
    EXPECT_EQ(CopyTo("127.0.0.1"), STATUS_AUTHENTICATION);
    EXPECT_THAT(report_.explanation,
                AllOf(HasSubstr("NAS shows " + front_.Fingerprint() + ", trusted was " + trusted),
                      HasSubstr("zelctl trust NAS")));
    EXPECT_THAT(daemon_.Log().substr(logged), Not(HasSubstr("allowed")));
}

TEST_F(RsyncWrapperTlsTest, WhatAnswersTooLateOrNotAtAllIsGivenUpAndACancelledRunLeavesNothing) {
    AddToSource("file", "content");
    Configure("answer_seconds=\"2\"\n");
    const auto begin = std::chrono::steady_clock::now();
    const auto command = [&](RsyncWrapper& wrapper) {
        wrapper.setTarqCustCmdRule({"command=\"X\""});
        wrapper.setDestPath("bob", "127.0.0.1", kPassword, "", "");
        wrapper.setTimeout(3);
    };
    RunOptions options;
    options.server = "nas";
    ServeCommands("cat > /dev/null; sleep 20");
    EXPECT_EQ(Copy(command, options), STATUS_TIMEOUT);
    EXPECT_THAT(report_.explanation, HasSubstr("nas did not answer the command within 2 seconds"));

    int asked = 0;
    const auto enough = [&] { return ++asked > 5; };
    EXPECT_EQ(Copy(command, options, enough), STATUS_CANCELLED);
    const char end = '\0';  // of each word
    const std::string helper =
        std::string("connect") + end + "127.0.0.1" + end + std::to_string(front_.Port()) + end;
    for (int i = 0; i < 20 && Has(OtherProcesses(), helper); ++i) {
        usleep(100000);
    }
    EXPECT_FALSE(Has(OtherProcesses(), helper));

    const int port = test::FreePort();
    const auto trust_port = [&] {
        TrustServer({"nas", ServerTransport::TLS, port, front_.Fingerprint()});
    };
    trust_port();
    EXPECT_EQ(Copy(command, options), STATUS_SOCKET);
    EXPECT_THAT(report_.explanation, HasSubstr("refuses connections on TLS port"));
    {
        Configure();
        const test::TricklingServer trickling(port, "127.0.0.1", true);
        EXPECT_EQ(Copy(command, options), 35);
        EXPECT_THAT(report_.explanation, HasSubstr("did not answer on TLS port"));
    }
    TrustServer({"nas", ServerTransport::TLS, daemon_.Port(), front_.Fingerprint()});
    EXPECT_EQ(Copy(command, options), STATUS_SOCKET);
    EXPECT_THAT(report_.explanation, HasSubstr("is no server with TLS 1.3"));
    EXPECT_LT(std::chrono::steady_clock::now() - begin, std::chrono::seconds(20));
}

TEST_F(RsyncWrapperTlsTest, ADamagedOrForeignFileOfServersFailsEveryRun) {
    AddToSource("file", "content");
    const std::string path = ServersPath();
    const std::string good = ReadFile(path);
    EXPECT_THAT(ListServers(), SizeIs(1));
    for (const auto& [text, words] : std::initializer_list<std::pair<std::string, std::string>>{
             {"[nas\n" + good, "line 1: '[nas' is no [server]"},
             {good + "[other]\ntransport=\"tsl\"\n", "transport is 'tsl'"},
             {good + "[other]\nport=\"1\"\n", "has no transport"},
             {good + "[NAS]\ntransport=\"plain\"\n", "is there twice"},
             {good + "[other]\ntransport=\"tls\"\nfingerprint=\"SHA256:x\"\n", "43 characters"},
             {good + "transport=\"plain\"\n", "is there twice"},
             {good + "fingerprnt=\"x\"\n", "is unknown"},
             {good + "\x80\n", "is neither"},
         }) {
        std::ofstream(path) << text;
        EXPECT_EQ(CopyTo("127.0.0.1"), STATUS_SYNTAX);
        EXPECT_THAT(report_.explanation, HasSubstr(words));
        EXPECT_THROW(TrustServer({"third", ServerTransport::PLAIN, 0, ""}), ServersError);
        EXPECT_EQ(ReadFile(path), text);
    }
    std::ofstream(path) << "# kept\n" << good;
    chmod(path.c_str(), 0666);
    EXPECT_EQ(CopyTo("127.0.0.1"), STATUS_SYNTAX);
    EXPECT_THAT(report_.explanation, HasSubstr("may be written by others"));
    chmod(path.c_str(), 0644);

    // Two who write at once lose nothing, and comments stay.
    std::vector<std::thread> writers;
    for (int i = 0; i < 4; ++i) {
        writers.emplace_back([i] {
            for (int j = 0; j < 5; ++j) {
                TrustServer({"h" + std::to_string(10 * i + j), ServerTransport::PLAIN, 0, ""});
            }
        });
    }
    for (std::thread& writer : writers) {
        writer.join();
    }
    EXPECT_THAT(ListServers(), SizeIs(21));
    EXPECT_TRUE(ForgetServer("H12"));
    EXPECT_FALSE(ForgetServer("h12"));
    EXPECT_THAT(ReadFile(path), StartsWith("# kept\n"));
    EXPECT_EQ(CopyTo("127.0.0.1"), 0) << report_.explanation;
    EXPECT_EQ(ServerName("2001:DB8:0::1"), "2001:db8::1");
    EXPECT_TRUE(IsLoopbackHost("127.1.2.3") && IsLoopbackHost("LocalHost") &&
                IsLoopbackHost("::1"));
    EXPECT_FALSE(IsLoopbackHost("128.0.0.1") || IsLoopbackHost("localhost.evil.example"));
}

TEST_F(RsyncWrapperTlsTest, EachHalfOfAConnectionIsClosedInItsOwnTime) {
    // Says what it was told only when it has been told all.
    test::ServerProcess late;
    const int port = test::FreePort();
    const std::string script =
        "import socket\n"
        "s = socket.create_server(('127.0.0.1', " +
        std::to_string(port) +
        "))\n"
        "while True:\n"
        "    c = s.accept()[0]\n"
        "    t = b''.join(iter(lambda: c.recv(65536), b''))\n"
        "    try: c.sendall(t[::-1])\n"
        "    except OSError: pass\n"
        "    c.close()\n";
    late.Start({"python3", "-c", script}, root_.Path("log"), port);
    const test::TlsFront front(port);
    const std::string connect = "'" CONNECT "' ::1 " + std::to_string(front.Port()) + " 5 1 " +
                                front.Fingerprint() + " nas rsync --server";
    const auto run = [](const std::string& line) {
        return test::RunProgram("", {"sh", "-c", line}).output;
    };
    EXPECT_EQ(
        run("{ head -c 3000000 /dev/zero; echo abc; } | " + connect + " | { head -c 4; wc -c; }"),
        "\ncba3000000\n");
    // A server that says nothing more and closes nothing holds nobody who has nothing to say.
    const std::string open = root_.Path("open");
    EXPECT_EQ(run("mkfifo '" + open + "' && " + connect + " 2>&1 0<>'" + open + "'"),
              "connect: nothing has moved for 1 s\n");
}

/// The same with ssh in between.
class RsyncWrapperSshTest : public RsyncWrapperTest {
protected:
    void SetUp() override {
        if (!test::SshServer::Available()) {
            GTEST_SKIP() << "this machine cannot run an ssh server for the test";
        }
        server_ = std::make_unique<test::SshServer>(passphrase_);
        daemon_.AddAccount(server_->User(), passphrase_);
        UseKey(false);
    }

    void UseKey(bool with_passphrase) {
        Configure("ssh_options=\"-F none -o IdentitiesOnly=yes -i " +
                  server_->ClientKey(with_passphrase) + "\"\n");
    }

    /// Login and daemon have an account of the same name; the module "open" asks for none.
    int Over(
        const std::string& password, const Set& set = [](auto&) {},
        const Cancelled& cancelled = nullptr) {
        const auto over = [&](RsyncWrapper& wrapper) {
            wrapper.setSsh(true);
            wrapper.setPort(server_->Port());
            wrapper.setDestPath(server_->User(), "127.0.0.1", password, "open", "");
            set(wrapper);
        };
        return Copy(over, {}, cancelled);
    }

    // Of this test alone: another one's server may show its own in a command line.
    const std::string passphrase_ = "open 'sesame' $% " + std::to_string(getpid());
    const std::string known_hosts_ = root_.Path("usr/tarq/etc/tarqrsync_known_hosts");
    const Set command_ = [](RsyncWrapper& w) { w.setTarqCustCmdRule({"command=\"X\""}); };
    std::unique_ptr<test::SshServer> server_;
};

TEST_F(RsyncWrapperSshTest, FailuresSayWhichEndRefusedAndWhatToDo) {
    AddToSource("file", "content");
    const std::string module = daemon_.AddModule("open", "auth users =");
    EXPECT_EQ(Over(""), 0) << report_.explanation;
    EXPECT_EQ(ReadFile(module + "/file"), "content");
    EXPECT_EQ(Over("", command_), 43);
    UseKey(true);
    EXPECT_EQ(Over("wrong"), 5);
    EXPECT_THAT(report_.explanation,
                StartsWith("the ssh login of '" + server_->User() + "' at 127.0.0.1 was refused"));
    UseKey(false);
    EXPECT_EQ(Over("", [](auto& w) { w.setPort(test::FreePort()); }), 10);
    EXPECT_THAT(report_.explanation, HasSubstr("is its ssh server running?"));

    server_->ChangeHostKey();
    EXPECT_EQ(Over(""), 5);
    EXPECT_THAT(report_.explanation, AllOf(HasSubstr("host key of 127.0.0.1 has changed"),
                                           HasSubstr("remove line 1 of " + known_hosts_)));
    fs::remove(known_hosts_);
    daemon_.Stop();
    EXPECT_EQ(Over(""), 10);
    EXPECT_THAT(report_.explanation, HasSubstr("no rsync daemon answers there on port " +
                                               std::to_string(daemon_.Port())));
}

TEST_F(RsyncWrapperSshTest, AKilledRunLeavesNoPasswordAndATrustedHostKeyIsTheOnlyOneTaken) {
    UseKey(true);
    AddToSource("file", "content");
    const std::string module = daemon_.AddModule("open", "auth users =");
    const pid_t run = fork();
    if (run == 0) {
        // ssh stays for as long as the server works on what it was told.
        ServeCommands("cat > /dev/null; sleep 3");
        Over(passphrase_, command_);
        _exit(0);
    }
    const std::string words = "UserKnownHostsFile=\"" + known_hosts_ + "\"" + '\0';
    for (int i = 0; i < 100 && !Has(OtherProcesses(), words); ++i) {
        usleep(50000);
    }
    usleep(300000);
    kill(run, SIGKILL);
    waitpid(run, nullptr, 0);
    for (const auto& entry : fs::recursive_directory_iterator(root_.Path("tmp"))) {
        EXPECT_FALSE(entry.is_regular_file() && Has(ReadFile(entry.path()), passphrase_));
    }

    for (int i = 0; i < 400 && Has(OtherProcesses(), words); ++i) {
        usleep(50000);
    }
    EXPECT_FALSE(Has(OtherProcesses(), words));

    // Reached by a name, at a port that the file says.
    fs::remove(known_hosts_);
    const SshHostKey key = FetchHostKey("127.0.0.1", server_->Port(), "", 10);
    EXPECT_EQ(FetchHostKey("127.0.0.1", server_->Port(), key.fingerprint, 10).key, key.key);
    TrustServer({"nas", ServerTransport::SSH, server_->Port(), key.fingerprint}, key);
    EXPECT_EQ(FindHostKey("NAS")->fingerprint, key.fingerprint);
    EXPECT_FALSE(Has(ReadFile(known_hosts_), "127.0.0.1"));
    RunOptions options;
    options.server = "nas";
    const auto to = [&](RsyncWrapper& wrapper) {
        wrapper.setDestPath(server_->User(), "127.0.0.1", passphrase_, "open", "");
    };
    EXPECT_EQ(Copy(to, options), 0) << report_.explanation << report_.details;
    EXPECT_EQ(ReadFile(module + "/file"), "content");
    server_->ChangeHostKey();
    EXPECT_EQ(Copy(to, options), STATUS_AUTHENTICATION);
    EXPECT_THAT(report_.explanation, HasSubstr("zelctl trust nas --ssh"));
    EXPECT_TRUE(ForgetServer("nas"));
    EXPECT_EQ(ReadFile(known_hosts_), "");
}

TEST_F(RsyncWrapperSshTest, APassphraseOpensADirectoryAndIsSeenNowhereAndACancelledRunLeavesNoSsh) {
    UseKey(true);
    AddToSource("file", "content");
    const std::string directory = root_.Path("far away 'dir'");
    fs::create_directories(directory);
    const auto to_directory = [&](RsyncWrapper& w) {
        w.setDestPath(server_->User(), "127.0.0.1", passphrase_, directory, "sub");
        w.setSrcPath(Source("file"));
        w.setTarqPseudoRoot(true);
    };
    EXPECT_EQ(Over(passphrase_, to_directory), 0) << report_.explanation;
    EXPECT_EQ(ReadFile(directory + "/sub"), "content");

    ServeCommands("cat > /dev/null; sleep 20");
    int asked = 0;
    std::string seen;
    const auto look = [&] {
        seen += OtherProcesses();
        return ++asked > 5;
    };
    EXPECT_EQ(Over(passphrase_, command_, look), 20);
    EXPECT_FALSE(Has(seen, passphrase_));
    // In the words of ssh itself: rsync holds the same ones quoted.
    const std::string words = "UserKnownHostsFile=\"" + known_hosts_ + "\"" + '\0';
    EXPECT_TRUE(Has(seen, words));
    EXPECT_FALSE(Has(OtherProcesses(), words));
    ExpectNothingLeft();
}

}  // namespace

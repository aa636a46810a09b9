#include "tarq/rsync_wrapper.h"

#include <dirent.h>

#include "tests/integration/servers.h"
#include "tests/support/syslog_capture.h"
#include "tests/support/testing.h"

namespace {

using TARQ::Backup::RsyncWrapper;
using TARQ::Backup::RunCause;
using TARQ::Backup::RunChange;
using TARQ::Backup::RunOptions;
using TARQ::Backup::RunProgress;
using TARQ::Backup::RunReport;
using TARQ::Backup::ScopedRunOptions;
using namespace testing;

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

    void ServeCommands(const std::string& script) {
        const std::string handler = root_.Write("handler", "#!/bin/sh\n" + script);
        chmod(handler.c_str(), 0700);
        daemon_.AddCommandModule(handler);
    }

    static void Prepare(RsyncWrapper& wrapper) {
        wrapper.setTarqAuth(true, true);
        wrapper.setDestPath(test::RsyncDaemon::kUser, "127.0.0.1", test::RsyncDaemon::kPassword, "",
                            "");
    }

    int RunWith(RsyncWrapper& wrapper, RunOptions options = {},
                const std::function<bool()>& cancelled = nullptr) {
        report_ = RunReport();
        options.report = &report_;
        const ScopedRunOptions scope(options);
        return wrapper.execute(cancelled);
    }

    int Command(const std::list<std::string>& lines,
                const std::function<bool()>& cancelled = nullptr) {
        RsyncWrapper wrapper;
        Prepare(wrapper);
        wrapper.setListOnly(true);
        wrapper.setDebugLog(true);
        wrapper.setTarqCustCmdRule(lines);
        return RunWith(wrapper, {}, cancelled);
    }

    /// Copies `source` to the module, with what `set` says beside.
    int Copy(
        const std::string& source, const std::function<void(RsyncWrapper&)>& set = [](auto&) {},
        const RunOptions& options = {}, const std::function<bool()>& cancelled = nullptr) {
        RsyncWrapper wrapper;
        Prepare(wrapper);
        wrapper.setDestPath(test::RsyncDaemon::kUser, "127.0.0.1", test::RsyncDaemon::kPassword,
                            "data", "");
        wrapper.setSrcPath(source);
        wrapper.setDelete(true);
        set(wrapper);
        return RunWith(wrapper, options, cancelled);
    }

    std::string Source(const std::string& name = "") const { return root_.Path("share/" + name); }
    void AddToSource(const std::string& name, const std::string& content = "") {
        root_.Write("share/" + name, content);
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

    /// What runs have left in the client's temporary folder.
    std::set<std::string> Leftovers() const {
        std::set<std::string> names = Tree(root_.Path("tmp"));
        names.erase("ZEL");
        return names;
    }

    test::TempRoot root_;
    test::RsyncDaemon daemon_;
    std::string module_;
    RunReport report_;
};

/// Command lines and environments, joined, of all processes but this one.
std::vector<std::string> OtherProcesses() {
    std::vector<std::string> texts;
    for (const auto& entry : fs::directory_iterator("/proc")) {
        const std::string proc = entry.path();
        const std::string text = test::ReadFile(proc + "/cmdline");
        if (!text.empty() && atoi(entry.path().filename().c_str()) != getpid()) {
            texts.push_back(text + test::ReadFile(proc + "/environ"));
        }
    }
    return texts;
}

size_t CountProcesses(const std::string& word) {
    const auto processes = OtherProcesses();
    return static_cast<size_t>(std::count_if(
        processes.begin(), processes.end(),
        [&](const std::string& text) { return text.find(word) != std::string::npos; }));
}

constexpr char kEchoHandler[] =
    "tee \"$ANSWERS/../../received\" | {\n"
    "  IFS='\"' read -r _ session _\n"
    "  { printf 'status=\"214\"\\n\\000one\\ntwo'; } > \"$ANSWERS/$session\"\n"
    "  cat > /dev/null; }\n";

TEST_F(RsyncWrapperTest, ACommandReachesTheHandlerAndItsAnswerTheOutfile) {
    ServeCommands(kEchoHandler);
    const std::string outfile = root_.Write("tmp/ZEL/out", "longer than the answer will be");
    struct stat before, after;
    ASSERT_EQ(stat(outfile.c_str(), &before), 0);
    EXPECT_EQ(
        Command({"command=\"X\"", "clientID=\"\"", "outfile=\"" + outfile + "\"", "last=\"1\""}),
        214);

    EXPECT_EQ(test::ReadFile(outfile), std::string("\0one\ntwo", 8));
    ASSERT_EQ(stat(outfile.c_str(), &after), 0);
    EXPECT_EQ(after.st_ino, before.st_ino);
    EXPECT_THAT(test::ReadFile(daemon_.Folder("received")),
                testing::ContainsRegex("^session=\"[0-9a-f]{32}\"\ncommand=\"X\"\nclientID=\"\"\n"
                                       "outfile=\"[^\n]*\"\nlast=\"1\"\n$"));
    EXPECT_THAT(report_.explanation, HasSubstr("status 214"));
    // Before that stands whoever asked whether the daemon answers.
    const std::string log = daemon_.Log();
    EXPECT_THAT(log.substr(log.find("allowed access")), Not(HasSubstr("error")));
    EXPECT_THAT(Leftovers(), UnorderedElementsAre("ZEL/out"));
}

TEST_F(RsyncWrapperTest, ACommandOfExactlyTheLimitIsCarriedAndOneByteMoreIsNotSent) {
    ServeCommands(kEchoHandler);
    const size_t session_line = 9 + 32 + 2;
    const std::string fits(TARQ::Backup::kMaxCommandBytes - session_line - 1, 'x');

    EXPECT_EQ(Command({fits + "x"}), TARQ::Backup::STATUS_COMMAND_TOO_LONG);
    EXPECT_THAT(report_.explanation, HasSubstr("5121 bytes"));
    EXPECT_FALSE(fs::exists(daemon_.Folder("received")));

    EXPECT_EQ(Command({fits}), 214);
    EXPECT_EQ(test::ReadFile(daemon_.Folder("received")).size(), TARQ::Backup::kMaxCommandBytes);
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
    struct Case {
        const char* kind;
        int status;
        const char* words;
    };
    for (const Case& c : std::initializer_list<Case>{
             {"link", 12, "no file"},
             {"fifo", 12, "no file"},
             {"folder", 12, "no file"},
             {"large", 12, "larger than"},
             {"none", 23, "left no answer"},
             {"crash", 5, "the program that takes commands"},
             {"status=0\\n", 12, "does not begin with a status"},
         }) {
        SCOPED_TRACE(c.kind);
        EXPECT_EQ(Command({"kind=\"" + std::string(c.kind) + "\"", "outfile=\"" + outfile + "\""}),
                  c.status);
        EXPECT_THAT(report_.explanation, HasSubstr(c.words));
        EXPECT_EQ(test::ReadFile(outfile), "before");
    }
    EXPECT_THAT(Leftovers(), UnorderedElementsAre("ZEL/out"));
}

TEST_F(RsyncWrapperTest, AnOutfileThatCannotBeWrittenIsAFailure) {
    ServeCommands(kEchoHandler);
    fs::create_symlink(root_.Write("elsewhere", "kept"), root_.Path("link"));
    EXPECT_EQ(Command({"outfile=\"" + root_.Path("none/out") + "\""}), 11);
    EXPECT_EQ(Command({"outfile=\"" + root_.Path("link") + "\""}), 11);
    EXPECT_THAT(report_.explanation, HasSubstr("cannot be written to " + root_.Path("link")));
    EXPECT_EQ(test::ReadFile(root_.Path("elsewhere")), "kept");
}

TEST_F(RsyncWrapperTest, FailuresHaveTheirStatusAndSayInPlainWordsWhatIsWrong) {
    AddToSource("file");
    struct Case {
        const char* name;
        int status;
        const char* words;
        std::function<void(RsyncWrapper&)> set;
    };
    const auto to = [](const std::string& user, const std::string& host,
                       const std::string& password, const std::string& module,
                       const std::string& sub = "") {
        return [=](RsyncWrapper& w) { w.setDestPath(user, host, password, module, sub); };
    };
    const std::string pass = test::RsyncDaemon::kPassword;
    for (const Case& c : std::initializer_list<Case>{
             {"password", 5, "wrong account or password", to("bob", "127.0.0.1", "x", "data")},
             {"no password", 5, "none is set", to("bob", "127.0.0.1", "", "data")},
             {"account", 5, "wrong account or password", to("eve", "127.0.0.1", pass, "data")},
             {"no account", 5, "no account is given", to("", "127.0.0.1", pass, "data")},
             {"module", 5, "no module 'nope'", to("bob", "127.0.0.1", pass, "nope")},
             {"no module", 1, "no module is given", to("bob", "127.0.0.1", pass, "")},
             {"host", 10, "host name no.such.invalid is unknown",
              to("bob", "no.such.invalid", pass, "data")},
             {"command", 43, "takes no server commands",
              [](RsyncWrapper& w) { w.setTarqCustCmdRule({"command=\"X\""}); }},
             {"broken command", 1, "line break",
              [](RsyncWrapper& w) { w.setTarqCustCmdRule({"command=\"X\"\nb=\"\""}); }},
             {"port", 10, "is its rsync daemon running?",
              [](RsyncWrapper& w) { w.setPort(test::FreePort()); }},
             {"bad port", 1, "not between", [](RsyncWrapper& w) { w.setPort(65536); }},
             {"source", 3, "does not exist", [](RsyncWrapper& w) { w.setSrcPath("/no/such"); }},
             {"option as host", 1, "neither a host", to("bob", "-oProxyCommand=x", pass, "data")},
             {"option as user", 1, "account name", to("-x", "127.0.0.1", pass, "data")},
             {"option as module", 1, "cannot be one", to("bob", "127.0.0.1", pass, "-x")},
             {"way out", 1, "'..'", to("bob", "127.0.0.1", pass, "data", "a/../../b")},
         }) {
        SCOPED_TRACE(c.name);
        EXPECT_EQ(Copy(Source(), c.set), c.status);
        EXPECT_THAT(report_.explanation, HasSubstr(c.words));
        EXPECT_EQ(report_.status, c.status);
        EXPECT_THAT(report_.explanation, Not(HasSubstr(pass)));
        EXPECT_EQ(report_.cause == RunCause::UNKNOWN_MODULE,
                  std::string(c.name) == "module" || std::string(c.name) == "command");
    }
    EXPECT_THAT(Tree(module_), IsEmpty());
}

TEST_F(RsyncWrapperTest, TheSystemLogGetsTheExplanationOfAFailureAndNothingElse) {
    test::TakeSyslog();
    RsyncWrapper wrapper;
    Prepare(wrapper);
    wrapper.setTarqCustCmdRule({"command=\"X\""});
    wrapper.logError();
    EXPECT_THAT(test::TakeSyslogTexts(), IsEmpty());
    EXPECT_EQ(wrapper.execute(nullptr), 43);
    wrapper.logError();
    EXPECT_THAT(test::TakeSyslogTexts(), Contains(HasSubstr("Unknown module 'zel_command'")));
}

TEST_F(RsyncWrapperTest, APasswordIsInNoArgumentNoEnvironmentAndNoFileOfARun) {
    ServeCommands("cat > /dev/null; sleep 1");
    const std::string secret = test::RsyncDaemon::kPassword;
    bool seen_rsync = false;
    Command({"command=\"X\""}, [&] {
        for (const std::string& text : OtherProcesses()) {
            EXPECT_THAT(text, Not(HasSubstr(secret)));
            seen_rsync = seen_rsync || text.find("--early-input=") != std::string::npos;
        }
        for (const std::string& name : Leftovers()) {
            struct stat info;
            if (stat(root_.Path("tmp/" + name).c_str(), &info) == 0 && S_ISREG(info.st_mode)) {
                EXPECT_EQ(info.st_mode & 077, 0U) << name;
                EXPECT_THAT(test::ReadFile(root_.Path("tmp/" + name)), Not(HasSubstr(secret)));
            }
        }
        return false;
    });
    EXPECT_TRUE(seen_rsync);
    EXPECT_THAT(test::ReadFile(root_.Path("var/log/tarqrsync.log")),
                AllOf(HasSubstr("rsync"), Not(HasSubstr(secret))));
}

TEST_F(RsyncWrapperTest, ACancelledRunEndsWithinASecondAndLeavesNothing) {
    ServeCommands("cat > /dev/null; sleep 20");
    // A program that does not mind being asked to end, with a child of its own.
    const std::string deaf =
        root_.Write("deaf", "#!/bin/sh\ntrap '' TERM\nsleep 54321 & sleep 54321\n");
    chmod(deaf.c_str(), 0700);
    for (const std::string& program : {std::string("rsync"), deaf}) {
        SCOPED_TRACE(program);
        Configure("rsync=\"" + program + "\"\n");
        const auto asked = std::chrono::steady_clock::now() + std::chrono::milliseconds(300);
        EXPECT_EQ(
            Command({"command=\"X\""}, [&] { return std::chrono::steady_clock::now() > asked; }),
            20);
        EXPECT_LT(std::chrono::steady_clock::now() - asked, std::chrono::seconds(1));
        EXPECT_EQ(report_.explanation, "the run was cancelled");
        EXPECT_EQ(CountProcesses("54321"), 0U);
        EXPECT_EQ(CountProcesses("--early-input=" + root_.Path()), 0U);
        EXPECT_THAT(Leftovers(), IsEmpty());
    }
}

TEST_F(RsyncWrapperTest, ACopyMirrorsContentAttributesAndDeletions) {
    AddToSource("a/file", "content");
    AddToSource("-dash");
    AddToSource("new\nline");
    AddToSource("wild*[card]?$(x) 'q' \"d\" \\#012");
    AddToSource("\xff\xfe broken");
    fs::create_symlink("a/file", Source("link"));
    mkfifo(Source("fifo").c_str(), 0600);
    chmod(Source("a/file").c_str(), 0641);
    AddToModule("gone/deep/file");

    EXPECT_EQ(Copy(Source(), [](RsyncWrapper& w) { w.setTarqPseudoRoot(true); }), 0);
    EXPECT_EQ(Tree(module_), Tree(Source()));
    EXPECT_EQ(fs::read_symlink(module_ + "/link").filename(), "file");
    struct stat here, there;
    stat(Source("a/file").c_str(), &here);
    stat((module_ + "/a/file").c_str(), &there);
    EXPECT_EQ(here.st_mode, there.st_mode);
    EXPECT_EQ(here.st_mtim.tv_sec, there.st_mtim.tv_sec);
    EXPECT_EQ(report_.files_deleted, 3U);
    EXPECT_EQ(report_.explanation, "");

    AddToModule("kept");
    EXPECT_EQ(Copy(Source(), [](RsyncWrapper& w) { w.setDelete(false); }), 0);
    EXPECT_TRUE(fs::exists(module_ + "/kept"));
}

TEST_F(RsyncWrapperTest, ARelativeSubTreeDeletesNothingOutsideOfIt) {
    AddToSource("docs/a/file");
    AddToSource("docs/other");
    for (const char* name : {"keep", "docs/keep", "docs/a/gone", "docs/b/keep"}) {
        AddToModule(name);
    }
    chmod(Source("docs").c_str(), 0751);
    EXPECT_EQ(Copy(Source("./docs/a"), [](RsyncWrapper& w) { w.setRelativePath(true); }), 0);
    EXPECT_THAT(Tree(module_), UnorderedElementsAre("keep", "docs", "docs/keep", "docs/a",
                                                    "docs/a/file", "docs/b", "docs/b/keep"));
    struct stat info;
    stat((module_ + "/docs").c_str(), &info);
    EXPECT_EQ(info.st_mode & 0777U, 0751U);
}

TEST_F(RsyncWrapperTest, ExcludeRulesAreTakenAsTheyStandAndProtectTheDestination) {
    const std::list<std::string> rules = {"#recycle", "+ x",   ";c",       "!",
                                          "- y",      "*.tmp", "new\nline"};
    for (const char* name : {"#recycle", "+ x", ";c", "!", "- y", "a.tmp", "new\nline", "copied"}) {
        AddToSource(name);
    }
    std::list<std::string> many = rules;
    for (int i = 0; i < 4000; ++i) {
        many.push_back("no-such-name-" + std::to_string(i));
    }
    for (const auto& list : {rules, many}) {
        fs::remove_all(module_);
        fs::create_directories(module_);
        AddToModule("protected.tmp");
        EXPECT_EQ(Copy(Source(), [&](RsyncWrapper& w) { w.setExcludeRule(list); }), 0);
        EXPECT_THAT(Tree(module_), UnorderedElementsAre("copied", "protected.tmp"));
    }
}

TEST_F(RsyncWrapperTest, ASourceThatCannotBeReadInFullDeletesNothing) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root to give rsync fewer rights than the test has";
    }
    const std::string weak =
        root_.Write("weak", "#!/bin/sh\nexec setpriv --reuid=65534 --clear-groups rsync \"$@\"\n");
    chmod(weak.c_str(), 0755);
    chmod(root_.Path().c_str(), 0755);
    Configure("rsync=\"" + weak + "\"\n");
    AddToSource("aaa/file");
    AddToSource("zzz/file");
    AddToModule("aaa/gone");
    AddToModule("zzz/gone");
    for (const char* locked : {"zzz", "zzz/file"}) {
        SCOPED_TRACE(locked);
        chmod(Source(locked).c_str(), 0);
        EXPECT_EQ(Copy(Source()), 23);
        EXPECT_THAT(report_.explanation,
                    AllOf(HasSubstr("source cannot be read"), HasSubstr("nothing was deleted"),
                          HasSubstr(locked)));
        EXPECT_THAT(Tree(module_), IsSupersetOf({"aaa/gone", "zzz/gone"}));
        chmod(Source(locked).c_str(), 0755);
    }
    EXPECT_EQ(Copy(Source()), 0);
    EXPECT_EQ(Tree(module_), Tree(Source()));
}

TEST_F(RsyncWrapperTest, AFarEndWithoutAclsOrAttributesGetsTheFilesWithoutThem) {
    AddToSource("file", "content");
    const std::string plain = daemon_.AddModule("plain", "refuse options = acls xattrs");
    test::TakeSyslog();
    EXPECT_EQ(Copy(Source(),
                   [](RsyncWrapper& w) {
                       w.setTarqAcl(true);
                       w.setDestPath("bob", "127.0.0.1", test::RsyncDaemon::kPassword, "plain", "");
                   }),
              0);
    EXPECT_EQ(test::ReadFile(plain + "/file"), "content");
    EXPECT_THAT(test::TakeSyslogTexts(),
                Contains(HasSubstr("cannot keep the access control lists")));
}

TEST_F(RsyncWrapperTest, ADryRunTellsEachChangeAndMakesNone) {
    AddToSource("sub/new\nname", "12345");
    AddToModule("old");
    std::multimap<std::string, std::pair<int, uint64_t>> changes;
    RunOptions options;
    options.dry_run = true;
    options.on_change = [&](const RunChange& c) { changes.insert({c.path, {c.kind, c.length}}); };
    EXPECT_EQ(Copy(
                  Source(), [](auto&) {}, options),
              0);
    using Kinds = std::pair<int, uint64_t>;
    EXPECT_THAT(
        changes,
        IsSupersetOf({std::pair<const std::string, Kinds>{"sub/new\nname", {RunChange::SEND, 5}},
                      {"old", {RunChange::DELETE, 0}},
                      {"sub/", {RunChange::OTHER, 0}}}));
    EXPECT_THAT(Tree(module_), UnorderedElementsAre("old"));

    changes.clear();
    options.dry_run = false;
    EXPECT_EQ(Copy(
                  "", [](RsyncWrapper& w) { w.setListOnly(true); }, options),
              0);
    EXPECT_THAT(changes, UnorderedElementsAre(
                             std::pair<const std::string, Kinds>{"old", {RunChange::SEND, 3}},
                             std::pair<const std::string, Kinds>{"./", {RunChange::OTHER, 0}}));
}

TEST_F(RsyncWrapperTest, ProgressGrowsToTheFiguresOfTheReportAndTheLimitHolds) {
    AddToSource("one", std::string(600 * 1024, 'x'));
    AddToSource("two", std::string(600 * 1024, 'y'));
    std::vector<RunProgress> seen;
    RunOptions options;
    options.bandwidth_limit = 1024;
    options.on_progress = [&](const RunProgress& p) { seen.push_back(p); };
    const auto start = std::chrono::steady_clock::now();
    EXPECT_EQ(Copy(
                  Source(), [](auto&) {}, options),
              0);
    EXPECT_GT(std::chrono::steady_clock::now() - start, std::chrono::milliseconds(500));
    ASSERT_GE(seen.size(), 2U);
    EXPECT_LT(seen.front().bytes_done, seen.back().bytes_done);
    EXPECT_EQ(seen.back().bytes_done, 1200U * 1024);
    EXPECT_EQ(report_.files_sent, 2U);
    EXPECT_EQ(report_.bytes_total, 1200U * 1024);
    EXPECT_GT(report_.bytes_sent, report_.bytes_total);
}

TEST_F(RsyncWrapperTest, AKilledPushNeverLeavesHalfAFileUnderItsNameAndTheNextOneCompletes) {
    std::string content(4U << 20, '\0');
    std::generate(content.begin(), content.end(), std::mt19937());
    AddToSource("large", content);
    for (const bool delta : {false, true}) {
        SCOPED_TRACE(delta);
        fs::remove_all(module_);
        fs::create_directories(module_);
        RunOptions slow;
        slow.bandwidth_limit = 1024;
        uint64_t done = 0;
        slow.on_progress = [&](const RunProgress& p) { done = p.bytes_done; };
        const auto set = [&](RsyncWrapper& w) { w.setDeltaCopy(delta); };
        EXPECT_EQ(Copy(Source(), set, slow, [&] { return done > 1U << 19; }), 20);
        EXPECT_FALSE(fs::exists(module_ + "/large"));
        // The daemon notices the broken connection by itself; what it keeps of the file it has in
        // hand lies apart.
        for (int i = 0; delta && i < 200 && !fs::exists(module_ + "/.tarqrsync-partial/large");
             ++i) {
            usleep(10000);
        }
        EXPECT_EQ(Copy(Source(), set), 0);
        EXPECT_EQ(test::ReadFile(module_ + "/large"), content);
        EXPECT_THAT(Tree(module_), UnorderedElementsAre("large"));
        EXPECT_EQ(report_.bytes_sent < content.size(), delta);
    }
}

TEST_F(RsyncWrapperTest, AServerThatGoesAwayIsABrokenConnection) {
    AddToSource("large", std::string(8U << 20, 'x'));
    RunOptions slow;
    slow.bandwidth_limit = 1024;
    slow.on_progress = [&](const RunProgress& p) {
        if (p.bytes_done > 1U << 19) {
            daemon_.Stop();
        }
    };
    EXPECT_THAT(Copy(
                    Source(), [](auto&) {}, slow),
                testing::AnyOf(10, 12));
    EXPECT_THAT(report_.explanation, StartsWith("the connection to 127.0.0.1"));
}

TEST_F(RsyncWrapperTest, AnRsyncThatIsMissingOrTooOldIsNamed) {
    AddToSource("file");
    Configure("rsync=\"no-such-rsync\"\n");
    EXPECT_EQ(Copy(Source()), 127);
    EXPECT_EQ(report_.explanation, "the program no-such-rsync is not installed");
    const std::string old =
        root_.Write("old",
                    "#!/bin/sh\n[ \"$1\" = --version ] && { echo 'rsync  version 3.1.3  protocol "
                    "version 31'; exit; }\n"
                    "echo 'rsync: --early-input=x: unknown option' >&2; exit 1\n");
    chmod(old.c_str(), 0700);
    Configure("rsync=\"" + old + "\"\n");
    EXPECT_EQ(Command({"command=\"X\""}), 1);
    EXPECT_THAT(report_.explanation, StartsWith(old + " is rsync 3.1.3, which is too old"));

    root_.Write("usr/tarq/etc/tarqrsync.conf", "[rsync]\nport=\"many\"\n");
    EXPECT_EQ(Copy(Source()), 1);
    EXPECT_THAT(report_.explanation, HasSubstr("port 'many'"));
}

TEST_F(RsyncWrapperTest, TheDebugLogIsRotatedAndAFolderWithoutRightsIsNoFailure) {
    AddToSource("file");
    const auto logged = [](RsyncWrapper& w) { w.setDebugLog(true); };
    const std::string log = root_.Write("var/log/tarqrsync.log", std::string(1024 * 1024, 'x'));
    EXPECT_EQ(Copy(Source(), logged), 0);
    EXPECT_LT(fs::file_size(log), 4096U);
    EXPECT_EQ(fs::file_size(log + ".1"), 1024U * 1024);
    EXPECT_THAT(test::ReadFile(log), Not(HasSubstr("file\n")));
    fs::remove_all(root_.Path("var/log"));
    EXPECT_EQ(Copy(Source(), logged), 0);
}

/// The same with ssh in between.
class RsyncWrapperSshTest : public RsyncWrapperTest {
protected:
    void SetUp() override {
        if (!test::SshServer::Available()) {
            GTEST_SKIP() << "this machine cannot run an ssh server for the test";
        }
        server_ = std::make_unique<test::SshServer>();
        daemon_.AddAccount(server_->User(), test::SshServer::kPassphrase);
        UseKey(false);
    }

    void UseKey(bool with_passphrase) {
        Configure("ssh_options=\"-F none -o IdentitiesOnly=yes -i " +
                  server_->ClientKey(with_passphrase) + "\"\n");
    }

    /// Login and daemon have an account of the same name; the module "open" asks for none.
    int Over(const std::string& password, const std::function<void(RsyncWrapper&)>& set,
             const std::function<bool()>& cancelled = nullptr) {
        RsyncWrapper wrapper;
        wrapper.setSsh(true);
        wrapper.setPort(server_->Port());
        wrapper.setTarqAuth(true, true);
        wrapper.setDestPath(server_->User(), "127.0.0.1", password, "open", "");
        wrapper.setSrcPath(Source());
        wrapper.setDelete(true);
        set(wrapper);
        return RunWith(wrapper, {}, cancelled);
    }

    std::unique_ptr<test::SshServer> server_;
};

TEST_F(RsyncWrapperSshTest, ModulesCommandsAndDirectoriesAreReached) {
    AddToSource("file", "content");
    ServeCommands(kEchoHandler);
    const std::string module = daemon_.AddModule("open", "auth users =");
    EXPECT_EQ(Over("", [](auto&) {}), 0) << report_.explanation;
    EXPECT_EQ(test::ReadFile(module + "/file"), "content");
    EXPECT_THAT(test::ReadFile(root_.Path("usr/tarq/etc/tarqrsync_known_hosts")),
                HasSubstr("127.0.0.1"));

    UseKey(true);
    EXPECT_EQ(Over(test::SshServer::kPassphrase,
                   [](RsyncWrapper& w) { w.setTarqCustCmdRule({"command=\"X\""}); }),
              214)
        << report_.explanation;
    const std::string directory = root_.Path("far away 'dir'");
    fs::create_directories(directory);
    EXPECT_EQ(Over(test::SshServer::kPassphrase,
                   [&](RsyncWrapper& w) {
                       w.setDestPath(server_->User(), "127.0.0.1", test::SshServer::kPassphrase,
                                     directory, "sub");
                       w.setSrcPath(Source("file"));
                       w.setTarqPseudoRoot(true);
                   }),
              0)
        << report_.explanation;
    EXPECT_EQ(test::ReadFile(directory + "/sub"), "content");
    EXPECT_THAT(Leftovers(), IsEmpty());
}

TEST_F(RsyncWrapperSshTest, FailuresSayWhichEndRefusedAndWhatToDo) {
    AddToSource("file");
    daemon_.AddModule("open", "auth users =");
    EXPECT_EQ(Over("", [](auto&) {}), 0) << report_.explanation;
    EXPECT_EQ(Over("", [](RsyncWrapper& w) { w.setTarqCustCmdRule({"command=\"X\""}); }), 43);
    UseKey(true);
    EXPECT_EQ(Over("wrong", [](auto&) {}), 5);
    EXPECT_THAT(report_.explanation,
                StartsWith("the ssh login of '" + server_->User() + "' at 127.0.0.1 was refused"));
    UseKey(false);
    EXPECT_EQ(Over("", [](RsyncWrapper& w) { w.setPort(test::FreePort()); }), 10);
    EXPECT_THAT(report_.explanation, HasSubstr("is its ssh server running?"));

    server_->ChangeHostKey();
    EXPECT_EQ(Over("", [](auto&) {}), 5);
    EXPECT_THAT(
        report_.explanation,
        AllOf(HasSubstr("host key of 127.0.0.1 has changed"),
              HasSubstr("remove line 1 of " + root_.Path("usr/tarq/etc/tarqrsync_known_hosts"))));
    fs::remove(root_.Path("usr/tarq/etc/tarqrsync_known_hosts"));
    daemon_.Stop();
    EXPECT_EQ(Over("", [](auto&) {}), 10);
    EXPECT_THAT(report_.explanation, HasSubstr("no rsync daemon answers there on port " +
                                               std::to_string(daemon_.Port())));
}

TEST_F(RsyncWrapperSshTest, APassphraseIsSeenNowhereAndACancelledRunLeavesNoSsh) {
    ServeCommands("cat > /dev/null; sleep 20");
    UseKey(true);
    const std::string secret = test::SshServer::kPassphrase;
    const std::string known_hosts = root_.Path("usr/tarq/etc/tarqrsync_known_hosts");
    int asked = 0;
    size_t seen_ssh = 0;
    EXPECT_EQ(Over(
                  secret, [](RsyncWrapper& w) { w.setTarqCustCmdRule({"command=\"X\""}); },
                  [&] {
                      EXPECT_EQ(CountProcesses(secret), 0U);
                      seen_ssh = std::max(seen_ssh, CountProcesses(known_hosts));
                      return ++asked > 5;
                  }),
              20);
    EXPECT_GE(seen_ssh, 2U);
    EXPECT_EQ(CountProcesses(known_hosts), 0U);
    EXPECT_THAT(Leftovers(), IsEmpty());
}

}  // namespace

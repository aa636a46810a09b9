#include "platform/internal/child_process.h"
#include "platform/internal/unique_fd.h"
#include "platform/tarqrsync/answer_file.h"
#include "platform/tarqrsync/arguments.h"
#include "platform/tarqrsync/explain.h"
#include "platform/tarqrsync/message_keeper.h"
#include "platform/tarqrsync/output_parser.h"
#include "tests/support/testing.h"

namespace TARQ::Backup {
namespace {

using tarq_internal::ChildResult;
using tarq_internal::ChildSetup;
using namespace testing;

TEST(Answer, OnlyAPlainDecimalStatusInTheFirstLineIsTaken) {
    struct Case {
        std::string text;
        int status;  // -1: refused
        std::string content;
    };
    for (const Case& c : std::initializer_list<Case>{
             {"status=\"0\"\n", 0, ""},
             {"status=\"214\"\na:b\n\n", 214, "a:b\n\n"},
             {"status=\"999999999\"\nx", 999999999, "x"},
             {std::string("status=\"7\"\n\0z", 13), 7, std::string("\0z", 2)},
             {"status=\"1000000000\"\n", -1, ""},
             {"status=\"00\"\n", -1, ""},
             {"status=\"-1\"\n", -1, ""},
             {"status=\"+1\"\n", -1, ""},
             {"status=\" 1\"\n", -1, ""},
             {"status=\"1\"", -1, ""},
             {"status=\"1\" \n", -1, ""},
             {"status=\"\"\n", -1, ""},
             {"status=\"\n", -1, ""},
             {"xstatus=\"1\"\n", -1, ""},
             {"\nstatus=\"1\"\n", -1, ""},
             {"", -1, ""},
         }) {
        SCOPED_TRACE(c.text);
        Answer answer;
        EXPECT_EQ(ParseAnswer(c.text, &answer), c.status >= 0);
        if (c.status >= 0) {
            EXPECT_EQ(answer.status, c.status);
            EXPECT_EQ(answer.content, c.content);
        }
    }
}

TEST(Answer, TheOutfileIsTheOneThatTheCommandNames) {
    EXPECT_EQ(OutfileOf({"command=\"a\"", "outfile=\"/tmp/x y\"", "outfile=\"/no\""}), "/tmp/x y");
    for (const char* line : {"outfile=\"", "outfile=\"\"", "myoutfile=\"/x\"", "outfile=/x", ""}) {
        EXPECT_EQ(OutfileOf({line}), "") << line;
    }
}

/// Everything that a parser hands on, from the same output in pieces of every size.
TEST(OutputParser, HandsOnTheSameHoweverTheOutputIsCut) {
    const std::string output =
        "\r          32768   0%    0.00kB/s    0:00:00  "
        "\r       10518528  33%    9.50MB/s    0:00:02 (xfr#1, ir-chk=3/9)"
        "\n@@ <f+++++++++ 12 dir/new\\#012line\\#134#012\n@@ *deleting   0 old dir/\n"
        "@@ .d..t...... 4096 ./\n@@ broken\nskipping directory x\n" +
        std::string(70000, 'x') +
        "\n\nNumber of files: 7 (reg: 4, dir: 3)\nNumber of regular files transferred: 4\n"
        "Number of deleted files: 3\nTotal file size: 18446744073709551615 bytes\n"
        "Total bytes sent: 99999999999999999999\nTotal bytes received: 93";
    for (const size_t step : {size_t(1), size_t(2), size_t(7), size_t(4096), output.size()}) {
        RunReport report;
        std::vector<std::string> changes;
        RunProgress last;
        RunOptions options;
        options.report = &report;
        options.on_change = [&](const RunChange& c) {
            changes.push_back(std::to_string(c.kind) + " " + std::to_string(c.length) + " " +
                              c.path);
        };
        options.on_progress = [&](const RunProgress& p) { last = p; };
        OutputParser parser(options, /*listing=*/false);
        for (size_t i = 0; i < output.size(); i += step) {
            parser.Feed(std::string_view(output).substr(i, step));
        }
        parser.Finish();
        parser.FillReport(&report);
        EXPECT_THAT(changes, ElementsAre("0 12 dir/new\nline\\#012", "1 0 old dir/", "2 0 ./"));
        EXPECT_THAT(parser.OtherText(), StartsWith("@@ broken\nskipping directory x\n"));
        EXPECT_THAT((std::vector<uint64_t>{last.bytes_done, last.percent, last.bytes_per_second,
                                           last.files_left, last.files_total}),
                    ElementsAre(10518528, 33, 9961472, 3, 9));
        EXPECT_FALSE(last.totals_final);
        // More bytes sent than any connection carries are none.
        EXPECT_THAT(
            (std::vector<uint64_t>{report.files_total, report.files_sent, report.files_deleted,
                                   report.bytes_total, report.bytes_sent, report.bytes_received}),
            ElementsAre(7, 4, 3, UINT64_MAX, 0, 93));
    }
}

TEST(MessageKeeper, KeepsTheEndFromALinesStartAndDisarmsControlCharacters) {
    MessageKeeper keeper;
    keeper.Feed("\x1b[2J bell\a tab\t\x7f\r\n");
    EXPECT_EQ(keeper.Text(), "\\#033[2J bell\\#007 tab\t\\#177\n");
    for (int i = 0; i < 40000; ++i) {
        keeper.Feed("line " + std::to_string(i) + "\n");
    }
    EXPECT_LE(keeper.Text().size(), 64U * 1024);
    EXPECT_GT(keeper.Text().size(), 60U * 1024);
    EXPECT_THAT(keeper.Text(), AllOf(StartsWith("line "), EndsWith("line 39999\n")));
}

TEST(Explanation, ComesFromTheWordsAndTheKindOfRun) {
    Settings copy;
    copy.host = "nas";
    copy.user = "bob";
    copy.module = "data";
    copy.delete_missing = true;
    Settings ssh = copy;
    ssh.ssh = true;
    Settings command = copy;
    command.is_command = true;
    struct Case {
        const Settings& settings;
        int exit_code;
        const char* messages;
        int status;
        const char* first_line;
    };
    for (const Case& c : std::initializer_list<Case>{
             {copy, 11, "rsync: [receiver] write failed on \"x\": No space left on device (28)\n",
              11, "the disk of nas is full"},
             {command, 11, "rsync: write failed: No space left on device (28)\n", 11,
              "the local disk is full"},
             {copy, 24, "file has vanished: \"/x/No space left on device\"\n", 24,
              "some files vanished"},
             {copy, 23,
              "rsync: [receiver] mkstemp \"/Connection refused\" failed: Permission denied (13)\n",
              23, "not everything could be copied"},
             {ssh, 23,
              "rsync: [receiver] mkstemp \"/Connection refused\" failed: Permission denied (13)\n",
              23, "not everything could be copied"},
             {copy, 23, "a\nrsync: [sender] opendir \"x\" failed: Input/output error (5)\nb\n", 23,
              "the source cannot be read in full: rsync: [sender] opendir \"x\" failed: "
              "Input/output error (5); nothing was deleted at the destination"},
             {copy, 30, "io timeout after 600 seconds -- Connection refused\n", 30,
              "nothing moved"},
             {copy, 35, "", 35, "nas did not answer in time"},
             {copy, 5, "@ERROR: max connections (4) reached -- try again later\n", 5,
              "nas serves as many"},
             {copy, 5, "@ERROR: something {host} new\n", 5,
              "nas refused the run: @ERROR: something {host} new"},
             {ssh, 12, "bob@nas: Permission denied (publickey,password).\n", 5,
              "the ssh login of 'bob' at nas"},
             {ssh, 255, "ssh: connect to host nas port 22: Connection refused\n", 10,
              "nas refuses connections on ssh port 22"},
             {ssh, 12, "ssh: connect to host nas port 22: Connection timed out\n", 35,
              "nas did not answer on ssh"},
             {ssh, 12, "Host key verification failed.\n", 5, "the host key of nas has changed"},
             {copy, 77, "", 77, "rsync failed with exit code 77"},
         }) {
        SCOPED_TRACE(c.messages);
        const Verdict verdict = Judge({c.settings, Config(), c.exit_code, c.messages});
        EXPECT_EQ(verdict.status, c.status);
        EXPECT_THAT(verdict.first_line, StartsWith(c.first_line));
    }
}

class ArgumentsTest : public testing::Test {
protected:
    ArgumentsTest() {
        settings_.account = true;
        settings_.user = "bob";
        settings_.host = "fe80::1%eth0";
        settings_.password = "secret";
        settings_.module = "data";
        settings_.source = "rel:ative";
    }

    Invocation Build(const RunOptions& options = {}) {
        return CopyInvocation({settings_, config_, options, false, false, ""}, &folder_);
    }

    test::TempRoot root_;
    Settings settings_;
    Config config_;
    PrivateFolder folder_;
};

TEST_F(ArgumentsTest, EachTransportGetsItsOwnWayAndNoneShowsThePassword) {
    Invocation invocation = Build();
    EXPECT_THAT(invocation.arguments, IsSupersetOf({"--port=873", "--sockopts=TCP_NODELAY",
                                                    "--contimeout=60", "--password-file=-"}));
    EXPECT_EQ(invocation.arguments.back(), "bob@[fe80::1%eth0]::data/");
    EXPECT_EQ(*(invocation.arguments.end() - 2), "./rel:ative");
    EXPECT_EQ(*(invocation.arguments.end() - 3), "--");
    EXPECT_EQ(invocation.input, "secret\n");
    EXPECT_THAT(invocation.environment, Contains("LC_ALL=C"));

    settings_.ssh = true;
    settings_.port = 2222;
    config_.ssh_options = {"-J", "it's"};
    invocation = Build();
    EXPECT_THAT(
        invocation.environment,
        IsSupersetOf(
            {testing::Matcher<std::string>(AllOf(
                 StartsWith("RSYNC_CONNECT_PROG='ssh' '-J' 'it'\\''s' '-p' '2222' '-l' 'bob'"),
                 EndsWith("'-W' '127.0.0.1:873' '--' 'fe80::1%%eth0'"))),
             testing::Matcher<std::string>("SSH_ASKPASS_REQUIRE=force")}));
    EXPECT_THAT(invocation.arguments, Not(Contains(StartsWith("--port"))));
    for (const auto* words : {&invocation.arguments, &invocation.environment}) {
        EXPECT_THAT(*words, Not(Contains(HasSubstr("secret\n"))));
    }

    settings_.module = "/a dir";
    settings_.sub_path = "sub";
    settings_.password.clear();
    invocation = Build();
    EXPECT_THAT(invocation.arguments, Contains(AllOf(StartsWith("--rsh='ssh' '-J' 'it''s'"),
                                                     HasSubstr("BatchMode=yes"))));
    EXPECT_EQ(invocation.arguments.back(), "[fe80::1%eth0]:/a dir/sub");
    EXPECT_EQ(invocation.input, "");
}

std::string Shell(ChildSetup setup, const std::string& script, ChildResult* result = nullptr,
                  const std::function<bool()>& cancelled = nullptr) {
    std::string output;
    const auto append = [&output](const char* bytes, size_t size) { output.append(bytes, size); };
    setup.program = "/bin/sh";
    setup.arguments = {"sh", "-c", script};
    const ChildResult ended = tarq_internal::RunChild(setup, cancelled, append, append);
    if (result != nullptr) {
        *result = ended;
    }
    return output;
}

TEST(ChildProcess, QuotedWordsComeThroughAShellUnchanged) {
    const std::vector<std::string> words = {
        "/usr/bin/printf", "%s|", "it's", "$(x) `y` \\ \"", " ", "", "%"};
    EXPECT_EQ(Shell({}, QuoteForShell(words)), "it's|$(x) `y` \\ \"| ||%|");
}

TEST(ChildProcess, InheritsNothingOfTheHost) {
    constexpr int kLeaked = 77;  // not close-on-exec
    const tarq_internal::UniqueFd leaked(dup2(STDERR_FILENO, kLeaked));
    signal(SIGUSR1, SIG_IGN);
    sigset_t blocked, before;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &blocked, &before);
    setenv("HOST_SECRET", "x", 1);
    ChildSetup setup;
    setup.environment = {"GIVEN=1"};
    setup.input = "in";
    const std::string output =
        Shell(setup,
              "cat; echo; for f in /proc/self/fd/*; do echo ${f##*/}; done;"
              "read -r _ _ _ _ group session tty _ < /proc/self/stat; "
              "echo $((group == session)) $tty $HOST_SECRET $GIVEN;"
              "while read -r l; do case $l in Sig[BI]*) echo $l;; esac; done < /proc/self/status");
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    signal(SIGUSR1, SIG_DFL);
    EXPECT_THAT(output, StartsWith("in\n0\n1\n2\n"));
    EXPECT_THAT(output, Not(HasSubstr("\n77\n")));
    EXPECT_THAT(output, HasSubstr("\n1 0 1\nSigBlk: 0000000000000000\nSigIgn: 0000000000000000\n"));
}

TEST(ChildProcess, EndsWithItsWholeGroupHoweverTheRunEnds) {
    const auto gone = [](const std::string& output) {
        const pid_t pid = std::stoi(output);
        for (int i = 0; i < 200; ++i) {
            const std::string stat = test::ReadFile("/proc/" + std::to_string(pid) + "/stat");
            if (kill(pid, 0) != 0 || stat.find(") Z ") != std::string::npos) {
                return true;
            }
            usleep(5000);
        }
        return false;
    };
    ChildResult result;
    EXPECT_TRUE(gone(Shell({}, "sleep 100 >/dev/null 2>&1 & echo $!", &result)));
    EXPECT_EQ(result.wait_status, 0);

    std::string pid;
    ChildSetup setup;
    setup.program = "/bin/sh";
    setup.arguments = {"sh", "-c", "sleep 100 & echo $!; wait"};
    const auto thrower = [&pid](const char* bytes, size_t size) {
        pid.assign(bytes, size);
        throw std::logic_error("stop");
    };
    EXPECT_THROW(tarq_internal::RunChild(setup, nullptr, thrower, nullptr), std::logic_error);
    EXPECT_TRUE(gone(pid));

    int asked = 0;
    pid = Shell({}, "sleep 100 & echo $!; wait", &result, [&asked] { return ++asked > 2; });
    EXPECT_TRUE(result.cancelled);
    EXPECT_TRUE(gone(pid));
    Shell({}, "exit 0", &result, [] { return true; });
    EXPECT_TRUE(result.cancelled);
}

TEST(ChildProcess, TellsWhyAProgramDidNotStartAndHowItEnded) {
    ChildSetup setup;
    setup.program = "/no/such";
    setup.arguments = {"x"};
    EXPECT_EQ(tarq_internal::RunChild(setup, nullptr, nullptr, nullptr).start_error, ENOENT);
    setup.input.assign(tarq_internal::kMaxChildInput + 1, 'x');
    EXPECT_EQ(tarq_internal::RunChild(setup, nullptr, nullptr, nullptr).start_error, E2BIG);

    ChildResult result;
    Shell({}, "exit 7", &result);
    EXPECT_EQ(WEXITSTATUS(result.wait_status), 7);
    const std::string large = Shell({}, "head -c 3000000 /dev/zero", &result);
    EXPECT_EQ(large.size(), 3000000U);

    const test::TempFolder folder;
    ChildSetup limited;
    limited.max_file_bytes = 1000;
    Shell(limited, "exec head -c 3000 /dev/zero > " + folder.Path("f"), &result);
    EXPECT_NE(result.wait_status, 0);
    EXPECT_EQ(test::ReadFile(folder.Path("f")).size(), 1000U);

    signal(SIGCHLD, SIG_IGN);
    EXPECT_EQ(Shell({}, "echo x", &result), "x\n");
    EXPECT_EQ(result.wait_status, -1);
    signal(SIGCHLD, SIG_DFL);
}

}  // namespace
}  // namespace TARQ::Backup

#include "base/child_process.h"
#include "base/unique_fd.h"
#include "platform/tarqrsync/answer_file.h"
#include "platform/tarqrsync/arguments.h"
#include "platform/tarqrsync/explain.h"
#include "platform/tarqrsync/message_keeper.h"
#include "platform/tarqrsync/output_parser.h"
#include "tests/support/testing.h"

namespace TARQ::Backup {
namespace {

using base::ChildResult;
using base::ChildSetup;
using namespace testing;

TEST(Answer, OnlyAPlainDecimalStatusInTheFirstLineIsTaken) {
    Answer answer;
    const std::string text("status=\"999999999\"\n\0z", 21);
    EXPECT_TRUE(ParseAnswer(text, &answer));
    EXPECT_EQ(answer.status, 999999999);
    EXPECT_EQ(answer.content, std::string("\0z", 2));
    for (const char* number : {"1000000000", "00", "-1", "+1", " 1", "1 ", ""}) {
        EXPECT_FALSE(ParseAnswer("status=\"" + std::string(number) + "\"\n", &answer)) << number;
    }
    for (const char* no_answer : {"status=\"1\"", "status=\"1\" \n", "status=\"\n",
                                  "xstatus=\"1\"\n", "\nstatus=\"1\"\n", ""}) {
        EXPECT_FALSE(ParseAnswer(no_answer, &answer)) << no_answer;
    }
    EXPECT_EQ(OutfileOf({"command=\"a\"", "outfile=\"/tmp/x y\"", "outfile=\"/no\""}), "/tmp/x y");
    for (const char* line : {"outfile=\"", "outfile=\"\"", "myoutfile=\"/x\"", "outfile=/x", ""}) {
        EXPECT_EQ(OutfileOf({line}), "") << line;
    }
}

/// Everything that a parser hands on, from the same output in pieces of every size.
TEST(OutputParser, HandsOnTheSameHoweverTheOutputIsCut) {
    const std::string output =
        "\r          32768   0%    0.00kB/s    0:00:00  "
        "\r       10518528  33%    9.50MB/s    0:00:02 (xfr#1, ir-chk=3/9)\n@@ .f          7 in "
        "step"
        "\n@@ <f+++++++++ 12 dir/new\\#012line\\#134#012\n@@ *deleting   0 old dir/\n"
        "@@ .d..t...... 4096 ./\n@@ broken\nskipping directory x\n" +
        std::string(70000, 'x') +
        "\n\nNumber of files: 7 (reg: 4, dir: 3)\nNumber of regular files transferred: 4\n"
        "Number of deleted files: 3\nTotal file size: 18446744073709551615 bytes\n"
        "Total bytes sent: 99999999999999999999\nTotal bytes received: 93";
    for (const size_t step : {size_t(1), size_t(2), size_t(7), size_t(4096), output.size()}) {
        RunReport report;
        std::ostringstream said;
        RunProgress last;
        RunOptions options;
        options.report = &report;
        options.on_change = [&](const RunChange& c) {
            said << c.kind << " " << c.length << " " << c.path << "|";
        };
        options.on_progress = [&](const RunProgress& p) { last = p; };
        OutputParser parser(options, /*listing=*/false);
        for (size_t i = 0; i < output.size(); i += step) {
            parser.Feed(std::string_view(output).substr(i, step));
        }
        parser.Finish();
        parser.FillReport(&report);
        for (const uint64_t number :
             {last.bytes_done, uint64_t(last.percent), last.bytes_per_second, last.files_checked,
              last.files_total, report.files_total, report.files_sent, report.files_deleted,
              report.bytes_total, report.bytes_sent, report.bytes_received}) {
            said << number << " ";
        }
        // More bytes sent than any connection carries are none.
        EXPECT_EQ(said.str(),
                  "0 12 dir/new\nline\\#012|1 0 old dir/|2 0 ./|10518528 0 9961472 9 9 "
                  "7 4 3 18446744073709551615 0 93 ");
        EXPECT_THAT(parser.OtherText(), StartsWith("@@ broken\nskipping directory x\n"));
        EXPECT_FALSE(last.totals_final);
    }
}

TEST(MessageKeeper, KeepsTheEndFromALinesStartAndDisarmsControlCharacters) {
    MessageKeeper keeper;
    keeper.Feed("\x1b[2J bell\a tab\t\x7f\r\n");
    EXPECT_EQ(keeper.Text(), "\\#033[2J bell\\#007 tab\t\\#177\n");
    for (int i = 0; i < 40000; ++i) {
        keeper.Feed("line " + std::to_string(i) + "\n");
    }
    EXPECT_LE(keeper.Text().size(), 17U * 1024);
    EXPECT_THAT(keeper.Text(), AllOf(HasSubstr("\nline 0\n"), HasSubstr("\n[...]\nline "),
                                     EndsWith("line 39999\n")));
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
    const std::string full =
        "rsync: [receiver] write failed on \"x\": No space left on device (28)\n";
    const std::string denied =
        "rsync: [receiver] mkstemp \"/Connection refused\" failed: Permission denied (13)\n";
    const std::string unreadable = "rsync: [sender] opendir \"x\" failed: Input/output error (5)";
    const std::string stopped =
        "rsync error: received SIGINT, SIGTERM, or SIGHUP (code 20) at rsync.c(725) ";
    for (const auto& [settings, exit_code, messages, status, first_line] :
         std::initializer_list<std::tuple<Settings, int, std::string, int, std::string>>{
             {copy, 11, full, 11, "the disk of nas is full"},
             {command, 11, full, 11, "the local disk is full"},
             {copy, 24, "vanished: \"/No space left on device\"\n", 24, "some files vanished"},
             {copy, 23, denied + denied + denied, 23,
              "not everything could be copied: mkstemp \"/Connection refused\" failed: Permission "
              "denied (13), and 2 more"},
             {ssh, 23, denied, 23, "not everything could be copied"},
             {copy, 23, "a\n" + unreadable + "\nb\n", 23,
              "the source cannot be read in full: opendir \"x\" failed: Input/output error (5)"
              "; nothing was deleted at the destination"},
             {copy, 30, "io timeout -- Connection refused\n", 30, "nothing moved"},
             {copy, 5, "@ERROR: {host} new\n", 5, "nas refused the run: @ERROR: {host} new"},
             {ssh, 255, "connect: Connection timed out\n", 35, "nas did not answer on ssh port 22"},
             {copy, 5, "@ERROR: " + std::string(5000, 'x') + "\n", 5,
              "nas refused the run: @ERROR: " + std::string(392, 'x') + "..."},
             {copy, 20, stopped + "[Receiver=3.5.0]\n", 12, "nas ended the run"},
             {copy, 20, stopped + "[sender=3.5.0]\n", 20, "rsync was ended by a signal on this"},
             {command, 20, stopped + "[sender=3.5.0]\n", 12, "nas ended the run"},
             {command, 20, stopped + "[receiver=3.5.0]\n", 20, "rsync was ended by a signal on"},
             {copy, 12,
              "rsync: connection unexpectedly closed (9 bytes received so far) [sender]\n", 12,
              "nas closed the connection"},
             {copy, 77, "", 77, "rsync failed with exit code 77"},
         }) {
        const Route route = {"nas", settings.ssh ? Transport::DAEMON_OVER_SSH : Transport::DAEMON,
                             settings.ssh ? 22 : 873, "", false};
        const Verdict verdict = Judge({settings, route, base::RsyncConfig(), exit_code, messages});
        EXPECT_EQ(verdict.status, status) << messages;
        EXPECT_THAT(verdict.first_line, StartsWith(first_line));
    }

    // A source that is being changed is told from one that cannot be read.
    const std::string open = "rsync: [sender] send_files failed to open \"/x (2)\": ";
    const std::string busy = open + "Is a directory (21)\nfile has vanished: \"/y\"\n" + open +
                             "Too many levels of symbolic links (40)\n" +
                             "ERROR: z failed verification -- update discarded.\n\n" +
                             "rsync error: some files/attrs were not transferred (see above)\n";
    const Route route;
    EXPECT_EQ(Judge({copy, route, base::RsyncConfig(), 23, busy}).cause, RunCause::BUSY_SOURCE);
    EXPECT_EQ(
        Judge({copy, route, base::RsyncConfig(), 23, busy + open + "Permission denied (13)\n"})
            .cause,
        RunCause::UNREADABLE_SOURCE);
    EXPECT_EQ(Judge({copy, route, base::RsyncConfig(), 23, denied}).cause, RunCause::NONE);
}

/// What only odd names and addresses show: plain ones are seen to work against real servers.
TEST(Arguments, OddNamesAndAddressesComeThrough) {
    const test::TempRoot root;
    PrivateFolder folder;
    base::RsyncConfig config;
    config.ssh_options = {"-J", "it's"};
    Settings settings;
    settings.account = true;
    settings.user = "bob";
    settings.host = "fe80::1%eth0";
    settings.password = "secret";
    settings.module = "data";
    settings.source = "rel:ative";
    const auto build = [&] {
        const RunOptions options;
        const Route route = RouteOf(settings, options, config);
        return CopyInvocation({settings, route, config, options, false, false, ""}, &folder);
    };
    Invocation made = build();
    EXPECT_THAT(std::vector<std::string>(made.arguments.end() - 3, made.arguments.end()),
                ElementsAre("--", "./rel:ative", "bob@[fe80::1%eth0]::data/"));

    settings.ssh = true;
    settings.password.clear();
    made = build();
    EXPECT_THAT(made.environment,
                Contains(AllOf(StartsWith("RSYNC_CONNECT_PROG=exec 'ssh' '-J' 'it'\\''s'"),
                               EndsWith("'-W' '127.0.0.1:873' '--' 'fe80::1%%eth0'"))));

    settings.module = "/a dir";
    made = build();
    EXPECT_THAT(made.arguments, Contains(AllOf(StartsWith("--rsh='ssh' '-J' 'it''s'"),
                                               HasSubstr("BatchMode=yes"))));
    EXPECT_EQ(made.arguments.back(), "[fe80::1%eth0]:/a dir/");
}

/// What `script` writes; `setup` says the rest.
std::string Shell(const std::string& script, ChildResult* result, ChildSetup setup = {},
                  const std::function<bool()>& cancelled = nullptr) {
    std::string output;
    const auto append = [&output](const char* bytes, size_t size) { output.append(bytes, size); };
    setup.program = "/bin/sh";
    setup.arguments = {"sh", "-c", script};
    *result = base::RunChild(setup, cancelled, append, append);
    return output;
}

TEST(ChildProcess, InheritsNothingOfTheHost) {
    constexpr int kLeaked = 77;  // not close-on-exec
    const base::UniqueFd leaked(dup2(STDERR_FILENO, kLeaked));
    signal(SIGUSR1, SIG_IGN);
    sigset_t blocked, before;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &blocked, &before);
    setenv("HOST_SECRET", "x", 1);
    ChildSetup setup;
    setup.environment = {"GIVEN=1"};
    setup.input = "in";
    ChildResult result;
    const std::string output = Shell(
        "cat; echo; for f in /proc/self/fd/*; do echo ${f##*/}; done;"
        "read -r _ _ _ _ group session tty _ < /proc/self/stat; "
        "echo $((group == session)) $tty $HOST_SECRET $GIVEN;"
        "while read -r l; do case $l in Sig[BI]*) echo $l;; esac; done < /proc/self/status",
        &result, setup);
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
            if (stat.empty() || stat.find(") Z ") != std::string::npos) {
                return true;
            }
            usleep(5000);
        }
        return false;
    };
    ChildResult result;
    EXPECT_TRUE(gone(Shell("sleep 100 >/dev/null 2>&1 & echo $!", &result)));
    EXPECT_EQ(result.wait_status, 0);

    std::string pid;
    ChildSetup setup;
    setup.program = "/bin/sh";
    setup.arguments = {"sh", "-c", "sleep 100 & echo $!; wait"};
    const auto thrower = [&pid](const char* bytes, size_t size) {
        pid.assign(bytes, size);
        throw std::logic_error("stop");
    };
    EXPECT_THROW(base::RunChild(setup, nullptr, thrower, nullptr), std::logic_error);
    EXPECT_TRUE(gone(pid));

    int asked = 0;
    pid = Shell("sleep 100 & echo $!; wait", &result, {}, [&asked] { return ++asked > 10; });
    EXPECT_TRUE(result.cancelled);
    EXPECT_TRUE(gone(pid));
    Shell("exit 0", &result, {}, [] { return true; });
    EXPECT_TRUE(result.cancelled);
}

TEST(ChildProcess, TellsWhyAProgramDidNotStartAndHowItEnded) {
    ChildSetup setup;
    setup.program = "/no/such";
    setup.arguments = {"x"};
    EXPECT_EQ(base::RunChild(setup, nullptr, nullptr, nullptr).start_error, ENOENT);
    setup.input.assign(base::kMaxChildInput + 1, 'x');
    EXPECT_EQ(base::RunChild(setup, nullptr, nullptr, nullptr).start_error, E2BIG);

    ChildResult result;
    const std::vector<std::string> words = {
        "/usr/bin/printf", "%s|", "it's", "$(x) `y` \\ \"", " ", "", "%"};
    EXPECT_EQ(Shell(QuoteForShell(words) + "; exit 7", &result), "it's|$(x) `y` \\ \"| ||%|");
    EXPECT_EQ(WEXITSTATUS(result.wait_status), 7);
    EXPECT_EQ(Shell("head -c 3000000 /dev/zero", &result).size(), 3000000U);

    const test::TempFolder folder;
    ChildSetup limited;
    limited.max_file_bytes = 1000;
    Shell("exec head -c 3000 /dev/zero > " + folder.Path("f"), &result, limited);
    EXPECT_NE(result.wait_status, 0);
    EXPECT_EQ(fs::file_size(folder.Path("f")), 1000U);

    signal(SIGCHLD, SIG_IGN);
    EXPECT_EQ(Shell("echo x", &result), "x\n");
    EXPECT_EQ(result.wait_status, -1);
    signal(SIGCHLD, SIG_DFL);
}

}  // namespace
}  // namespace TARQ::Backup

// What zelctl says to the daemon and makes of its answers, with the program as people run it and a
// daemon that the test plays; and the parsers behind it.
#include <sys/time.h>

#include <mutex>
#include <nlohmann/json.hpp>

#include "ZEL/ipc.h"
#include "ZEL/stream.h"
#include "programs/common/schedule_words.h"
#include "programs/common/task_row.h"
#include "programs/common/text.h"
#include "programs/zelctl/child_output.h"
#include "programs/zelctl/doctor_checks.h"
#include "programs/zelctl/live_block.h"
#include "programs/zelctl/quick_list.h"
#include "programs/zelctl/samba.h"
#include "programs/zelctl/task_file.h"
#include "tests/integration/client_and_server.h"
#include "tests/support/testing.h"

using programs::DescribeSchedule;
using programs::ScheduleWords;
using test::Ended;
using test::Outcome;
using namespace testing;
using ZEL::PObject;

namespace {

// ---- Schedules in words ----

// One option with its days, and the times that go with it.
ScheduleWords Words(const std::string& option, const std::string& days, const std::string& at = "",
                    const std::string& every = "", int times = -1) {
    const auto value = [](bool given, const auto& text) {
        return given ? std::optional(text) : std::nullopt;
    };
    ScheduleWords words;
    words.manual = option == "manual";
    words.on_change = option == "on-change";
    words.weekly = value(option == "weekly", days);
    words.monthly = value(option == "monthly", days);
    words.yearly = value(option == "yearly", days);
    words.once = value(option == "once", days);
    words.at = value(!at.empty(), at);
    words.every = value(!every.empty(), every);
    words.times = value(times >= 0, static_cast<unsigned int>(times));
    return words;
}

TEST(ScheduleWords, WhatIsSaidIsWhatIsDescribedAndPassesTheLibrary) {
    const std::pair<ScheduleWords, const char*> cases[] = {
        {Words("manual", ""), "manual"},
        {Words("on-change", ""), "on change"},
        {Words("weekly", "Thu,mon", "02:30", "1h30m", 3),
         "weekly mon,thu 02:30, 3 more every 1h30m"},
        {Words("weekly", "sunday,wednesday"), "weekly wed,sun 00:00"},
        {Words("weekly", "weekends,fri", "8:05"), "weekly fri,sat,sun 08:05"},
        {Words("weekly", "daily", "", "90m", 1), "daily 00:00, 1 more every 1h30m"},
        {Words("weekly", "mon,tue,wed,thu,fri", "", "45m", 2), "weekdays 00:00, 2 more every 45m"},
        {Words("monthly", "31", "23:59"), "monthly 31 23:59"},
        {Words("yearly", "02-29"), "yearly 02-29 00:00"},
        {Words("once", "2032-02-29", "00:00", "2h", 11), "once 2032-02-29 00:00, 11 more every 2h"},
    };
    for (const auto& [words, described] : cases) {
        ZEL::Schedule schedule;
        EXPECT_EQ(ApplyWords(words, schedule), "") << described;
        EXPECT_EQ(DescribeSchedule(schedule), described);
        EXPECT_TRUE(schedule.Validate()) << described;
    }
    // What is not said stays, and a count of 0 takes the repeats away.
    ZEL::Schedule schedule;
    ApplyWords(Words("weekly", "sat", "05:00", "1h", 4), schedule);
    EXPECT_EQ(ApplyWords(Words("", "", "06:00"), schedule), "");
    EXPECT_EQ(DescribeSchedule(schedule), "weekly sat 06:00, 4 more every 1h");
    EXPECT_EQ(ApplyWords(Words("monthly", "2", "", "", 0), schedule), "");
    EXPECT_EQ(DescribeSchedule(schedule), "monthly 2 06:00");
    EXPECT_EQ(ApplyWords(Words("on-change", ""), schedule), "");
    EXPECT_TRUE(schedule.Validate());
}

TEST(ScheduleWords, FaultsNameTheOption) {
    ScheduleWords two = Words("weekly", "mon");
    two.on_change = true;
    const std::pair<ScheduleWords, const char*> cases[] = {
        {two, "only one of"},
        {Words("weekly", "mon,,tue"), "--weekly: ''"},
        {Words("weekly", "mon\033"), "'mon\\033'"},
        {Words("monthly", "0"), "--monthly"},
        {Words("monthly", "32"), "--monthly"},
        {Words("yearly", "02-30"), "--yearly"},
        {Words("yearly", "2-3-4"), "--yearly"},
        {Words("once", "2031-02-29"), "--once"},
        {Words("once", "1969-12-31"), "--once"},
        {Words("weekly", "mon", "24:00"), "--at"},
        {Words("weekly", "mon", "7"), "--at"},
        {Words("weekly", "mon", "+7:00"), "--at"},
        {Words("manual", "", "07:00"), "go with"},
        {Words("on-change", "", "", "1h", 2), "go with"},
        {Words("weekly", "mon", "", "1h"), "--every needs --times"},
        {Words("weekly", "mon", "", "", 2), "--times needs --every"},
        {Words("weekly", "mon", "", "0m", 2), "--every"},
        {Words("weekly", "mon", "", "24h", 1), "--every"},
        {Words("weekly", "mon", "", "90", 1), "--every"},
        {Words("weekly", "mon", "", "h5m", 1), "--every"},
        {Words("weekly", "mon", "", "1m", 96), "--times"},
        {Words("weekly", "mon", "23:00", "30m", 2), "on another day"},
    };
    for (const auto& [words, fault] : cases) {
        ZEL::Schedule schedule;
        EXPECT_THAT(ApplyWords(words, schedule), HasSubstr(fault));
    }
}

// ---- Rows, files and other people's text ----

TEST(TaskRow, TravelsWholeAndNoTextBreaksOut) {
    programs::TaskRow row;
    row.name = "a\x1f\n";
    row.shares = std::string(100000, 's');
    row.status = 2;
    row.percent = 45;
    row.next_run = -7;
    row.pending = UINT64_MAX;
    const std::string packed = PackTaskRow(row);
    EXPECT_LT(packed.size(), 65536U);
    programs::TaskRow read;
    ASSERT_TRUE(programs::UnpackTaskRow(packed, read));
    EXPECT_EQ(read.name, "a??");
    EXPECT_THAT(read.shares, testing::StartsWith("sss"));
    EXPECT_EQ(TaskStateWords(read), "running 45%");
    EXPECT_EQ(read.next_run, -7);
    EXPECT_EQ(read.pending, UINT64_MAX);
    EXPECT_FALSE(read.last_end || read.retry_in);
    for (const std::string& bad :
         {std::string(), packed + "x", packed.substr(1000), packed.substr(0, packed.size() - 1)}) {
        EXPECT_FALSE(programs::UnpackTaskRow(bad, read));
    }
}

TEST(Text, WhatATerminalObeysIsShownInstead) {
    EXPECT_EQ(programs::Printable("a\033[2J\xc2\x9b\x7f"), "a\\033[2J\\302\x9b\\177");
    const std::string plain = "\xc3\xa4 \xe2\x82\xac \xc2\xa0";
    EXPECT_EQ(programs::Printable(plain), plain);
    EXPECT_EQ(zelctl::CutToColumns("a\xc3\xa4z", 2), "a\xc3\xa4");
}

PObject SomeTask(const std::string& name, const std::string& share = "b") {
    ZEL::TaskInfo info;
    info.SetName(name);
    info.SetShareList({share});
    ZEL::SyncInfo sync;
    sync.SetServerName("nas2");
    sync.SetUser("alice");
    sync.SetPassword("secret");
    sync.SetSSH(true);
    sync.SetMaxBandwidth(UINT32_MAX);
    info.SetSyncInfo(sync);
    ApplyWords(Words("weekly", "mon", "08:00", "2h", 3), info.GetSchedule());
    PObject map;
    ZEL::TaskInfo2PObj(info, map);
    map["exclude"].asArray().emplace_back("*.tmp");
    return map;
}

TEST(TaskFile, ReadsWhatItWrites) {
    const PObject task = SomeTask("n\xc3\xa4me \"x\"");
    PObject stored = task;
    stored["id"] = 5;
    stored["last_error"] = "not part of it";
    for (const bool with_passwords : {true, false}) {
        const std::string text = zelctl::WriteTaskFile({stored}, with_passwords);
        const zelctl::TaskFile file = zelctl::ReadTaskFile(text);
        ASSERT_THAT(file.faults, IsEmpty());
        ASSERT_EQ(file.tasks.size(), 1U);
        PObject expected = task;
        if (!with_passwords) {
            expected.asMap().erase("pswd");
            EXPECT_THAT(text, Not(HasSubstr("secret")));
        }
        EXPECT_EQ(file.tasks[0].toString(), expected.toString());
    }
}

TEST(TaskFile, EachFaultHasItsPlace) {
    const auto faults = [](const std::string& tasks) {
        return zelctl::ReadTaskFile(R"({"format":"zelctl tasks","version":1,"tasks":)" + tasks +
                                    "}")
            .faults;
    };
    const std::string good = R"("name":"a","share_list":["x"],"user":"u","server_ip":"1.2.3.4")";
    EXPECT_THAT(faults("[{" + good + "}]"), IsEmpty());
    const std::pair<std::string, const char*> cases[] = {
        {"\n\n[}", "line 3 is no JSON"},
        {"{}", "tasks must be an array"},
        {"[7]", "tasks[0]: must be an object"},
        {"[{" + good + R"(,"colour":1}])", "tasks[0] ('a'): colour is no key"},
        {"[{" + good + R"(,"ssh":1}])", "ssh must be true or false"},
        {"[{" + good + R"(,"ssh_port":65536}])", "ssh_port must be a whole number"},
        {"[{" + good + R"(,"ssh_port":-1}])", "ssh_port must be a whole number"},
        {"[{" + good + R"(,"rsync_timeout":599}])", "from 600 to 86400"},
        {"[{" + good + R"(,"exclude":["a",2]}])", "exclude each of its elements must be a text"},
        {"[{" + good + R"(,"pswd":"a\u0000b"}])", "pswd must not hold a zero byte"},
        {"[{" + good + R"(,"pswd":")" + std::string(65536, 'p') + "\"}]", "pswd is too long"},
        {"[{" + good + R"(,"week_schd":"0000000"}])", "week_schd must be"},
        {"[{" + good + "},{" + good + "}]", "tasks[1]: a task before has the name 'a'"},
        {R"([{"name":"\u001b","share_list":[],"user":"u","server_name":"s"}])",
         "('\\033'): share_list is empty"},
        {R"([{"name":"b","share_list":["x"],"user":"u"}])", "server_name is missing"},
    };
    for (const auto& [tasks, fault] : cases) {
        EXPECT_THAT(faults(tasks), ElementsAre(HasSubstr(fault))) << tasks.substr(0, 100);
    }
    EXPECT_THAT(zelctl::ReadTaskFile("[]").faults, ElementsAre(HasSubstr("format")));
    EXPECT_THAT(zelctl::ReadTaskFile(R"({"format":"zelctl tasks","version":2})").faults,
                ElementsAre(HasSubstr("version")));
}

constexpr char kSamba[] =
    "# Global parameters\r\n[global]\n\tworkgroup = X\n\tpath = /no\n\n"
    "[homes]\n\tbrowseable = No\n[printers]\n\tprintable = Yes\n[print$]\n\tpath = /drivers\n"
    "[HP]\n\tpath = /spool\n\tprint ok = yes\n"
    "no section\n[Photos of us]\n\tcomment = a = b; [x]\n\tpath = /srv/photos  \n"
    "[user]\n\tpath = /home/%U\n[off]\n\tavailable = No\n\tPath = /srv\n[nothing]\n[rel]\npath=x\n"
    "[]\npath = /y\n[open\npath = /z";

TEST(Samba, SharesAreFoundAmongAllElse) {
    std::vector<std::string> found;
    for (const zelctl::SambaShare& share : zelctl::ParseSambaShares(kSamba)) {
        found.push_back(share.name + "|" + share.path + "|" + share.refusal.substr(0, 12));
    }
    EXPECT_THAT(found, ElementsAre("Photos of us|/srv/photos|", "user|/home/%U|its folder /",
                                   "off|/srv|Samba has it", "nothing||it names no ",
                                   HasSubstr("rel|x|its")));
    EXPECT_THAT(zelctl::ParseSambaShares(""), IsEmpty());
}

TEST(Doctor, TellsAnRsyncThatIsTooOld) {
    std::string version;
    EXPECT_TRUE(zelctl::IsUsableRsync("rsync  version 3.2.1  protocol version 31\n", version));
    EXPECT_TRUE(zelctl::IsUsableRsync("rsync  version 3.10.0pre1  protocol", version));
    EXPECT_EQ(version, "3.10.0pre1");
    EXPECT_TRUE(zelctl::IsUsableRsync("rsync  version v4.0dev  protocol", version));
    EXPECT_FALSE(zelctl::IsUsableRsync("rsync  version 3.2.0  protocol", version));
    EXPECT_FALSE(zelctl::IsUsableRsync("openrsync: protocol version 29", version));
    EXPECT_FALSE(zelctl::IsUsableRsync("", version));
}

// ---- The commands, against a daemon that is ours ----

/// Listens where the daemon would, notes the requests and answers by a function. A reply that is an
/// array is sent element after element; the connection is closed when it ends in null.
class FakeDaemon {
public:
    using Answer = std::function<PObject(const PObject& request)>;

    FakeDaemon(const std::string& socket, Answer answer) : answer_(std::move(answer)) {
        EXPECT_EQ(listener_.prepare(socket), 0);
        listener_.setTimeout({0, 20000});
        thread_ = std::thread([this] {
            while (!stop_) {
                if (listener_.isReady()) {
                    Serve(listener_.accept());
                }
            }
        });
    }
    ~FakeDaemon() {
        stop_ = true;
        thread_.join();
    }

    /// What was asked, as text.
    std::vector<std::string> Requests() {
        const std::lock_guard<std::mutex> lock(mutex_);
        return requests_;
    }

private:
    void Serve(int fd) {
        ZEL::Channel channel(81920);
        channel.Open(fd, true);
        channel.SetTimeout(5);
        for (bool open = true; open;) {
            PObject request;
            ZEL::PStream stream;
            if (stream.Recv(channel, request) != 0) {
                return;
            }
            {
                const std::lock_guard<std::mutex> lock(mutex_);
                requests_.push_back(request.toString());
            }
            const PObject reply = answer_(request);
            if (!reply.isArray()) {
                stream.Send(channel, reply);
            }
            for (const PObject& element : reply.asArray()) {
                open = open && !element.isNull() && stream.Send(channel, element) == 0;
            }
        }
    }

    Answer answer_;
    ZEL::IPCListener listener_;
    std::atomic<bool> stop_{false};
    std::mutex mutex_;
    std::vector<std::string> requests_;
    std::thread thread_;
};

PObject Success(const PObject::Map& more = {}) {
    PObject reply;
    reply = more;
    reply["result"] = 0;
    return reply;
}

PObject Refusal(int result, const std::string& error) {
    PObject reply;
    reply["result"] = result;
    reply["error"] = error;
    return reply;
}

// A reply of `watch` or `task_list`.
PObject TasksReply(const std::vector<PObject>& tasks) {
    PObject reply = Success();
    reply["tasks"].asArray() = tasks;
    return reply;
}

// A task as the daemon tells it in brief.
PObject Brief(const std::string& name, int status, int result, int last_run) {
    PObject task;
    task["name"] = name;
    task["share_list"].asArray().emplace_back("docs");
    task["server_name"] = "nas2";
    task["schedule"] = "daily 02:30";
    task["status"] = status;
    task["sync_result"] = result;
    task["last_run"] = last_run;
    task["last_start"] = 1000;
    task["last_end"] = 1065;
    return task;
}

class Zelctl : public testing::Test {
protected:
    Zelctl() {
        root_.Write("source/file", "x");
        root_.Write("password", "top secret\n");
        test::Must(Run({"share", "add", "docs", root_.Path("source")}));
    }

    Outcome Run(std::vector<std::string> arguments, const std::string& input = "",
                const std::function<bool()>& cancelled = nullptr) const {
        arguments.insert(arguments.begin(), ZELCTL);
        return test::RunProgram(root_.Path(), arguments, input, cancelled);
    }
    std::string Socket() const { return root_.Path("var/run/zel_daemon.sock"); }
    std::vector<std::string> AddCommand(const std::vector<std::string>& more) const {
        std::istringstream words("task add nightly --share docs --server nas2 --user alice");
        std::vector<std::string> command(std::istream_iterator<std::string>(words), {});
        command.insert(command.end(), {"--password-file", root_.Path("password")});
        command.insert(command.end(), more.begin(), more.end());
        return command;
    }

    const test::TempRoot root_;
};

TEST_F(Zelctl, WithoutADaemonEveryCommandSaysWhatToDo) {
    for (const std::vector<std::string>& command : {std::vector<std::string>{"task", "list"},
                                                    {"task", "run", "a"},
                                                    {"status"},
                                                    {"export"},
                                                    {"task", "watch"},
                                                    AddCommand({})}) {
        EXPECT_THAT(Run(command), Ended(3, "systemctl start zel_daemon")) << command[1];
    }
    EXPECT_THAT(Run({"tusk"}).output, HasSubstr("no command 'tusk'"));
    EXPECT_THAT(Run({"task", "lost"}).output, HasSubstr("no command 'task lost'"));
    EXPECT_EQ(Run({"task", "show"}).exit_code, 2);
}

TEST_F(Zelctl, AddSendsAWholeTaskAndShowsItsRunsButNeverThePassword) {
    FakeDaemon daemon(Socket(), [](const PObject& request) {
        return Success({{"task", request}});
    });
    const Outcome added =
        Run(AddCommand({"--weekly", "daily", "--at", "08:00", "--every", "2h", "--times", "3",
                        "--ssh", "--ssh-port", "2222", "--exclude", "*.tmp", "--exclude", "a b"}));
    EXPECT_EQ(added.exit_code, 0);
    EXPECT_THAT(added.output, AllOf(HasSubstr("'nightly' is added: daily 08:00, 3 more every 2h"),
                                    testing::ContainsRegex("(20[0-9-]* [01][0-9]:00:00 .*\n){3}"),
                                    Not(HasSubstr("secret"))));
    ASSERT_EQ(daemon.Requests().size(), 1U);
    EXPECT_THAT(daemon.Requests()[0],
                AllOf(HasSubstr("\"exclude\": [\"*.tmp\", \"a b\"]"), Not(HasSubstr("\"id\"")),
                      HasSubstr("\"pswd\": \"top secret\""), HasSubstr("\"ssh_port\": 2222"),
                      HasSubstr("\"week_schd\": \"1111111\"")));
    EXPECT_THAT(Run({"task", "add", "a", "--share", "docs", "-s", "nas2", "-u", "alice"}).output,
                HasSubstr("no password: give --password-file"));
    // What cannot be is told before anything is sent, and before a password is asked for.
    const std::pair<std::vector<std::string>, const char*> refused[] = {
        {{"--weekly", "daily", "--at", "25:00"}, "--at"},
        {{"--once", "2001-01-01"}, "lies in the past"},
        {{"--share", "none"}, "share 'none'"},
        {{"--share", "docs"}, "given twice"},
        {{"--timeout", "10"}, "--timeout"},
        {{"--exclude", std::string(65536, 'x')}, "'exclude' is too long"},
        {{"--password", "hunter2"}, "not expected"},
    };
    for (const auto& [more, text] : refused) {
        EXPECT_THAT(Run(AddCommand(more)), Not(Ended(0)));
        EXPECT_THAT(Run(AddCommand(more)).output, HasSubstr(text));
    }
    EXPECT_EQ(daemon.Requests().size(), 1U);
}

TEST_F(Zelctl, EditSendsOnlyWhatChanges) {
    FakeDaemon daemon(Socket(), [](const PObject&) {
        return Success({{"task", SomeTask("nightly")}});
    });
    EXPECT_EQ(Run({"task", "edit", "nightly", "--at", "09:00", "--no-ssh", "--server", "10.0.0.1",
                   "--rename", "daily", "--user", "alice", "--no-exclude"})
                  .exit_code,
              0);
    EXPECT_THAT(Run({"task", "edit", "nightly", "--user", "alice"}).output, HasSubstr("already"));
    EXPECT_THAT(Run({"task", "edit", "nightly", "--at", "20:00"}).output, HasSubstr("another day"));
    EXPECT_THAT(
        daemon.Requests(),
        ElementsAre(HasSubstr("task_show"),
                    "{\"command\": \"task_edit\", \"exclude\": [], \"name\": \"daily\", "
                    "\"schedule_begin_hour\": 9, \"server_ip\": \"10.0.0.1\", \"server_name\": "
                    "\"\", \"ssh\": 0, \"task\": \"nightly\"}",
                    HasSubstr("task_show"), HasSubstr("task_show")));
}

TEST_F(Zelctl, ErrorRepliesBecomeWordsAndExitCodes) {
    int result = 0;
    FakeDaemon daemon(Socket(), [&](const PObject&) {
        return result == 0 ? PObject("no map") : Refusal(result, "no task \033[31m'x'");
    });
    for (const auto& [code, exit_code] : {std::pair{-4, 2}, {-8, 3}, {-11, 3}, {-19, 3}, {-3, 3}}) {
        result = code;
        const Outcome outcome = Run({"task", "rm", "x"});
        EXPECT_EQ(outcome.exit_code, exit_code) << code;
        EXPECT_EQ(outcome.output, "zelctl: no task \\033[31m'x'\n");
    }
    result = 0;
    EXPECT_THAT(Run({"task", "list"}).output, HasSubstr("is no reply"));
}

TEST_F(Zelctl, ListsAreReadAsRowsOrAsMapsAndNothingInThemReachesTheTerminal) {
    bool knows_rows = true;
    FakeDaemon daemon(Socket(), [&](const PObject& request) {
        PObject task = Brief("bad\033]0;x\007", 0, 2, 4);
        task["note"] = "disk\033 full";
        if (!request.hasMember("rows")) {
            return TasksReply({task});
        }
        programs::TaskRow row;
        row.name = "in rows";
        row.note = "disk\302\233 full";
        PObject rows;
        rows.asArray().emplace_back(PackTaskRow(row));
        return knows_rows ? Success({{"rows", rows}}) : Refusal(-4, "unknown key");
    });
    EXPECT_THAT(Run({"task", "list"}).output,
                AllOf(HasSubstr("NAME"), HasSubstr("in rows  "), Not(HasSubstr("\302\233"))));
    knows_rows = false;
    EXPECT_THAT(Run({"task", "list"}).output,
                AllOf(HasSubstr("bad\\033]0;x\\007  docs"), HasSubstr("daily 02:30"),
                      HasSubstr("failed"), HasSubstr("disk\\033 full"), Not(HasSubstr("\033"))));
    const auto json = nlohmann::json::parse(Run({"task", "list", "--json"}).output);
    EXPECT_EQ(json[0]["name"], "bad\033]0;x\007");
    EXPECT_EQ(json[0]["result"], "failed");
    EXPECT_EQ(json[0]["last_run"], 4);
    EXPECT_THAT(daemon.Requests(), ElementsAre(HasSubstr("rows"), HasSubstr("rows"),
                                               HasSubstr("brief"), "{\"command\": \"task_list\"}"));
}

TEST_F(Zelctl, RunWaitsForItsOwnRunAndExitsByItsResult) {
    int result = 1;
    FakeDaemon daemon(Socket(), [&](const PObject& request) {
        if (request["command"].asString() != "watch") {
            return Success({{"after", 6}});
        }
        // The run before this one failed; that is not what is waited for.
        PObject ended = Brief("a", 0, result, 7);
        ended["last_status"] = result == 2 ? 11 : 0;
        ended["last_error"] = "No space left in /copies";
        PObject replies;
        replies.asArray() = {TasksReply({Brief("a", 1, 2, 6)}), TasksReply({Brief("a", 2, 2, 6)}),
                             TasksReply({ended}), PObject()};
        return replies;
    });
    EXPECT_EQ(Run({"task", "run", "a"}).exit_code, 0);
    EXPECT_THAT(Run({"task", "run", "a", "--wait"}), Ended(0, "a: done in 1:05"));
    result = 2;
    EXPECT_THAT(Run({"task", "run", "a", "--wait"}), Ended(1, "No space left in /copies"));
    result = 3;
    EXPECT_EQ(Run({"task", "run", "a", "-w"}).exit_code, 5);
    EXPECT_EQ(Run({"task", "run", "a", "b", "-w"}).exit_code, 5) << "b has gone";
}

TEST_F(Zelctl, AnInterruptLeavesTheRunGoing) {
    FakeDaemon daemon(Socket(), [&](const PObject& request) {
        return request["command"].asString() == "watch" ? TasksReply({Brief("a", 2, 0, 6)})
                                                        : Success({{"after", 6}});
    });
    // The shell sends the interrupt to the very process that it becomes.
    const std::string script =
        "(sleep 1; kill -INT $$) & exec " + std::string(ZELCTL) + " task run a --wait";
    EXPECT_THAT(test::RunProgram(root_.Path(), {"sh", "-c", script}),
                Ended(5, "the run of 'a' goes on"));
    EXPECT_THAT(daemon.Requests(), ElementsAre(HasSubstr("task_run"), HasSubstr("watch")));
}

TEST_F(Zelctl, WatchingAPipeTellsEachChangeOnce) {
    FakeDaemon daemon(Socket(), [](const PObject&) {
        PObject replies;
        replies.asArray() = {TasksReply({Brief("a", 0, 1, 1)}), TasksReply({Brief("a", 0, 1, 1)}),
                             TasksReply({Brief("a", 1, 1, 1)}), PObject()};
        return replies;
    });
    const Outcome outcome = Run({"task", "watch", "a"});
    EXPECT_EQ(outcome.exit_code, 3) << "the daemon broke off";
    EXPECT_THAT(outcome.output, testing::ContainsRegex("a: idle.*\n.*a: waiting.*\n"));
    EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 3);
}

TEST_F(Zelctl, ATerminalIsDrawnInPlaceWithinItsWindowAndLeftAsItWas) {
    FakeDaemon daemon(Socket(), [](const PObject& request) {
        std::vector<PObject> tasks;
        for (int i = 0; i < 30; ++i) {
            tasks.push_back(Brief("idle" + std::to_string(i), 0, 1, 1));
        }
        tasks.push_back(Brief("busy\t", 2, 1, 1));
        tasks.back()["progress_percent"] = 40;
        PObject replies;
        replies.asArray() = {TasksReply(tasks), TasksReply(tasks)};
        return request["command"].asString() == "watch" ? replies : Success({{"after", 1}});
    });
    const auto on_terminal = [&](const std::string& command) {
        const std::string script =
            "stty rows 6 cols 40; timeout -s INT 1 " + std::string(ZELCTL) + " task " + command;
        return test::RunProgram(root_.Path(), {"script", "-qec", script, "/dev/null"}).output;
    };
    const std::string watched = on_terminal("watch");
    const size_t again = watched.find("\033[5A");
    ASSERT_NE(again, std::string::npos) << watched;
    EXPECT_THAT(
        watched.substr(0, again),
        AllOf(HasSubstr("NAME"), HasSubstr("busy\\011"), HasSubstr("idle1"),
              Not(HasSubstr("idle2")), HasSubstr("and 28 lines more"), Not(HasSubstr("PENDING"))));
    EXPECT_THAT(watched, AllOf(HasSubstr("\033[?25l"), testing::EndsWith("\033[?25h")));
    EXPECT_THAT(on_terminal("run \"$(printf 'busy\\t')\" --wait"),
                AllOf(HasSubstr("[#########"), HasSubstr(" 40%"), HasSubstr("goes on")));
}

TEST_F(Zelctl, EachVerbAsksForWhatItSaysAndShowsTheAnswer) {
    FakeDaemon daemon(Socket(), [](const PObject& request) {
        PObject reply = Success();
        const std::string command = request["command"].asString();
        if (command == "task_show") {
            reply["task"] = SomeTask("t");
            reply["task"]["status"] = 2;
            reply["task"]["run"] = 9;
            reply["task"]["progress_share"] = "docs";
            reply["task"]["progress_percent"] = 50;
            reply["task"]["progress_bytes"] = 1048576;
            reply["task"]["progress_rate"] = 104857;
        } else if (command == "task_log") {
            PObject run;
            run["run"] = 9;
            run["start"] = 1000;
            run["end"] = 1100;
            run["sync_result"] = 2;
            run["reason"] = "retry";
            run["files_sent"] = 3;
            run["bytes_sent"] = 2048;
            run["error"] = "first\nsecond\033";
            reply["runs"].asArray() = {run};
        } else if (command == "daemon_status") {
            reply["version"] = "1.2";
            reply["workers"] = 2;
        }
        return reply;
    });
    const std::string task = "\"task\": \"t\"}";
    const std::pair<std::vector<std::string>, std::pair<std::string, std::string>> cases[] = {
        {{"task", "rm", "t"}, {"{\"command\": \"task_remove\", " + task, "is removed"}},
        {{"task", "cancel", "t"}, {"{\"command\": \"task_cancel\", " + task, "does not run"}},
        {{"task", "pause", "t"}, {"{\"command\": \"task_pause\", " + task, "is paused"}},
        {{"task", "resume", "t"}, {"{\"command\": \"task_resume\", " + task, "runs by its"}},
        {{"task", "show", "t"},
         {"{\"command\": \"task_show\", " + task,
          "progress         docs: 1.0 MiB, 102 KiB/s, 0:09 left"}},
        {{"task", "show", "t", "--json"},
         {"{\"command\": \"task_show\", " + task, "\"state\": \"running\""}},
        {{"task", "next", "t", "--count", "5", "--json"},
         {"{\"command\": \"task_show\", " + task, "14:00:00"}},
        {{"task", "log", "t", "--limit", "7"},
         {"{\"command\": \"task_log\", \"limit\": 7, " + task,
          "1:40  failed  retry   3      0        2.0 KiB  first; second\\033"}},
        {{"task", "log", "t", "--json"},
         {"{\"command\": \"task_log\", \"limit\": 20, " + task, "\"result\": \"failed\""}},
        {{"status"}, {"{\"command\": \"daemon_status\"}", "0, 0 running (2 workers)"}},
        {{"reload"}, {"{\"command\": \"reload\"}", "has read"}},
    };
    for (const auto& [command, expected] : cases) {
        const Outcome outcome = Run(command);
        EXPECT_EQ(outcome.exit_code, 0) << outcome.output;
        EXPECT_EQ(daemon.Requests().back(), expected.first);
        EXPECT_THAT(outcome.output, AllOf(HasSubstr(expected.second), Not(HasSubstr("secret"))));
    }
}

// ---- The list that stands on the wire format alone ----

/// What PrintTaskListQuickly() makes of these bytes.
bool ListQuickly(const test::TempRoot& root, const std::string& bytes) {
    ZEL::IPCListener listener;
    EXPECT_EQ(listener.prepare(root.Path("var/run/zel_daemon.sock")), 0);
    std::thread daemon([&] {
        ZEL::Channel channel(81920);
        PObject request;
        ZEL::PStream stream;
        channel.Open(listener.accept(), true);
        EXPECT_EQ(stream.Recv(channel, request), 0);
        EXPECT_EQ(request.toString(), "{\"command\": \"task_list\", \"rows\": 1}");
        channel.Write(bytes.data(), static_cast<unsigned int>(bytes.size()));
        channel.Close();
    });
    testing::internal::CaptureStdout();
    const bool printed = zelctl::PrintTaskListQuickly();
    daemon.join();
    const std::string output = testing::internal::GetCapturedStdout();
    EXPECT_EQ(printed, !output.empty());
    return printed;
}

TEST(QuickList, TakesAWholeReplyAndNothingLess) {
    const test::TempRoot root;
    EXPECT_FALSE(zelctl::PrintTaskListQuickly()) << "nobody listens";
    const std::string result("\x10\0\x06result\x01\x01\0", 12);
    const std::string row = programs::PackTaskRow({});
    const std::string rows =
        std::string("\x10\0\x04rows\x41\x10\0", 10) + static_cast<char>(row.size()) + row + "\x40";
    const std::string whole = "\x42" + result + rows + "\x40";
    EXPECT_TRUE(ListQuickly(root, whole));
    EXPECT_TRUE(ListQuickly(root, "\x42" + rows + result + "\x40"));
    for (size_t cut = 0; cut < whole.size(); cut += 3) {
        EXPECT_FALSE(ListQuickly(root, whole.substr(0, cut))) << cut;
    }
    std::string failed = whole;
    failed[12] = '\x05';
    std::string no_row = whole;
    no_row[whole.size() - 4] = 'x';
    for (const std::string& other : {failed, no_row, "\x42" + result + "\x40", "\x41" + whole,
                                     "\x42" + result + rows + result.substr(0, 9) + rows + "\x40",
                                     std::string("\x42\x42\x42")}) {
        EXPECT_FALSE(ListQuickly(root, other));
    }
}

// ---- With a real server ----

TEST(TaskDryRun, ListsWhatTheTaskWouldSend) {
    class Whole : public test::ClientAndServer {
    public:
        std::string Path(const std::string& name) const { return folder_.Path(name); }
    };
    const Whole whole;
    fs::create_directories(whole.Path("client/var/run"));
    test::Must(whole.Client(
        {"push", "docs", "-s", "127.0.0.1", "-u", "alice", "--password-file", "-", "-q"},
        "secret\n"));
    whole.Write("new", "n");
    whole.Write("left.tmp", "n");
    FakeDaemon daemon(whole.Path("client/var/run/zel_daemon.sock"), [](const PObject& request) {
        PObject reply = Success();
        reply["task"] = SomeTask("t", "docs");
        reply["task"]["server_name"] = "";
        reply["task"]["server_ip"] = "127.0.0.1";
        reply["task"]["ssh"] = 0;
        EXPECT_EQ(request["secrets"].asInt32(), 1);
        return reply;
    });
    EXPECT_THAT(whole.Client({"task", "run", "t", "--dry-run"}).output,
                AllOf(HasSubstr("send    new"), HasSubstr("1 file (1 B) would be"),
                      Not(HasSubstr("left.tmp"))));
}

TEST_F(Zelctl, ExportAndImportTakeAllAlongAndFaultsAddNothing) {
    std::vector<PObject> there;
    FakeDaemon daemon(Socket(), [&](const PObject& request) {
        return request["command"].asString() == "task_list" ? TasksReply(there) : Success();
    });
    there = {SomeTask("a", "docs")};
    const std::string file = root_.Path("tasks.json");
    EXPECT_EQ(Run({"export", "--with-passwords"}).exit_code, 2);
    EXPECT_EQ(Run({"export", file, "--with-passwords"}).exit_code, 0);
    EXPECT_EQ(test::ModeOf(file), 0600U);
    EXPECT_THAT(Run({"import", file}).output, HasSubstr("--replace"));
    const size_t asked = daemon.Requests().size();
    EXPECT_EQ(Run({"import", file, "--replace"}).exit_code, 0);
    ASSERT_EQ(daemon.Requests().size(), asked + 2);
    EXPECT_THAT(daemon.Requests().back(),
                AllOf(HasSubstr("task_edit"), HasSubstr("\"pswd\": \"secret\"")));

    there.clear();
    EXPECT_EQ(Run({"import", file}).exit_code, 0);
    EXPECT_THAT(daemon.Requests().back(), HasSubstr("task_add"));
    // The second task cannot be: the first is not added either.
    const PObject bad = SomeTask("b", "none");
    const PObject good = SomeTask("c", "docs");
    root_.Write("two.json", zelctl::WriteTaskFile({good, bad}, true));
    EXPECT_THAT(Run({"import", root_.Path("two.json")}).output,
                AllOf(HasSubstr("share 'none'"), HasSubstr("nothing was imported")));
    EXPECT_THAT(daemon.Requests().back(), HasSubstr("task_list"));
    // Passwords that are missing come from elsewhere, or nothing happens.
    root_.Write("one.json", zelctl::WriteTaskFile({good}, false));
    EXPECT_EQ(Run({"import", root_.Path("one.json")}).exit_code, 2);
    EXPECT_EQ(Run({"import", root_.Path("one.json"), "--password-file", "-"}, "pw\n").exit_code, 0);
    EXPECT_THAT(daemon.Requests().back(), HasSubstr("\"pswd\": \"pw\""));
}

TEST_F(Zelctl, SambaSharesAreTakenOverOnce) {
    if (zelctl::FindInPath("testparm").empty()) {
        GTEST_SKIP() << "needs testparm";
    }
    root_.Write("photos/file", "x");
    const std::string config = root_.Write(
        "smb.conf", "[global]\nworkgroup = X\n[Photos]\npath = " + root_.Path("photos") +
                        "\n[docs]\npath = " + root_.Path("source") + "\n[gone]\npath = /no/such\n");
    const Outcome listed = Run({"share", "import", "--samba", "--config", config, "-n"});
    EXPECT_THAT(listed.output, AllOf(HasSubstr("'Photos' would be"), HasSubstr("'docs' is in"),
                                     HasSubstr("'gone' is left out")));
    EXPECT_EQ(Run({"share", "import", "--samba", "--config", config, "photos"}).exit_code, 0);
    EXPECT_THAT(test::ReadFile(root_.Path("usr/tarq/etc/tarqshare.conf")), HasSubstr("[Photos]"));
    EXPECT_THAT(Run({"share", "list"}).output, Not(HasSubstr("gone")));
    EXPECT_THAT(Run({"share", "import", "--samba", "--config", "/no/such"}).output,
                HasSubstr("testparm cannot read"));
}

TEST_F(Zelctl, TheDoctorFindsWhatIsWrongAndHowToMendIt) {
    const int port = test::FreePort();
    FakeDaemon daemon(Socket(), [&](const PObject& request) {
        PObject task = SomeTask("nightly");
        task["share_list"].asArray().emplace_back("docs");
        task["server_name"] = "";
        task["server_ip"] = "127.0.0.1";
        task["ssh_port"] = port;
        PObject reply = TasksReply({task});
        reply["protocol"] = 1;
        reply["folders"] = 7;
        reply["store"] = root_.Write("store/tasks.db", "");
        return request["command"].asString() == "task_list" ? TasksReply({task}) : reply;
    });
    chmod(root_.Path("usr/tarq/etc/tarqshare.conf").c_str(), 0666);
    const Outcome outcome = Run({"doctor", "--json"});
    EXPECT_EQ(outcome.exit_code, 3);
    std::map<std::string, std::string> found;
    for (const auto& check : nlohmann::json::parse(outcome.output)) {
        found[check["name"]] =
            check["verdict"].get<std::string>() + ": " + check["finding"].get<std::string>();
        EXPECT_EQ(check["verdict"] == "ok", check["remedy"] == "") << check;
    }
    EXPECT_THAT(found["rsync"], HasSubstr("ok: version 3"));
    EXPECT_THAT(found["share docs"], HasSubstr("ok: ready (task nightly)"));
    EXPECT_THAT(found["share b"], HasSubstr("failed: "));
    EXPECT_THAT(found["file " + root_.Path("usr/tarq/etc/tarqshare.conf")], HasSubstr("0666"));
    EXPECT_THAT(found["file " + root_.Path("store/tasks.db")], HasSubstr("holds secrets"));
    EXPECT_THAT(found["watches"], HasSubstr("7 folders watched"));
    EXPECT_THAT(found["daemon"], HasSubstr("ok"));
    EXPECT_THAT(found["unit zel_daemon"], HasSubstr("failed: it is not installed"));
    EXPECT_THAT(found["server 127.0.0.1, port " + std::to_string(port)], HasSubstr("refused"));
}

}  // namespace

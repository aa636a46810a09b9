// What zelctl says to the daemon and makes of its answers, with the program as people run it and a
// daemon that the test plays; and the parsers behind it.
#include <sys/time.h>

#include <mutex>
#include <nlohmann/json.hpp>

#include "ZEL/ipc.h"
#include "ZEL/stream.h"
#include "programs/common/configuration.h"
#include "programs/common/json_text.h"
#include "programs/common/run_progress.h"
#include "programs/common/schedule_words.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_row.h"
#include "programs/common/task_settings.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/child_output.h"
#include "programs/zelctl/base/live_block.h"
#include "programs/zelctl/doctor/checks.h"
#include "programs/zelctl/share/samba.h"
#include "tests/integration/client_and_server.h"
#include "tests/support/schedules.h"
#include "tests/support/testing.h"

using programs::DescribeSchedule;
using programs::ScheduleWords;
using test::Ended;
using test::Outcome;
using namespace testing;
using ZEL::PObject;

namespace {

// ---- Schedules in words ----

// Puts what a line like "weekly=mon,tue at=08:00 every=1h times=2" says into a task; what is
// wrong with it, or nothing.
std::string Say(const std::string& line, programs::TaskSettings& task) {
    ScheduleWords said;
    const std::map<std::string, std::optional<std::string>*> options = {
        {"weekly", &said.weekly}, {"monthly", &said.monthly}, {"yearly", &said.yearly},
        {"once", &said.once},     {"at", &said.at},           {"every", &said.every}};
    std::istringstream words(line);
    for (std::string word; words >> word;) {
        const std::string name = word.substr(0, word.find('='));
        const std::string value = word.substr(name.size() + 1);
        if (name == "times") {
            said.times = static_cast<unsigned int>(std::stoul(value));
        } else if (options.count(name) > 0) {
            *options.at(name) = value;
        } else {
            (name == "manual" ? said.manual : said.on_change) = true;
        }
    }
    try {
        PObject settings;
        SayWords(said, settings);
        task.Apply(settings);
        return "";
    } catch (const programs::Failure& failure) {
        return failure.what();
    }
}

// One that lacks nothing but a schedule.
programs::TaskSettings Unscheduled() {
    programs::TaskSettings task;
    PObject said;
    said = PObject::Map{{"name", "t"}, {"user", "u"}, {"server_name", "s"}};
    said["share_list"].asArray().emplace_back("docs");
    task.Apply(said);
    return task;
}

TEST(ScheduleWords, WhatIsSaidIsWhatIsDescribedAndPassesTheLibrary) {
    const std::pair<const char*, const char*> cases[] = {
        {"manual=", "manual"},
        {"on-change=", "on change"},
        {"weekly=Thu,mon at=02:30 every=1h30m times=3", "weekly mon,thu 02:30, 3 more every 1h30m"},
        {"weekly=weekends,friday at=8:05", "weekly fri,sat,sun 08:05"},
        {"weekly=daily every=90m times=1", "daily 00:00, 1 more every 1h30m"},
        {"weekly=mon,tue,wed,thu,fri", "weekdays 00:00"},
        {"monthly=31 at=23:59", "monthly 31 23:59"},
        {"yearly=02-29", "yearly 02-29 00:00"},
        {"once=2032-02-29 every=2h times=11", "once 2032-02-29 00:00, 11 more every 2h"},
    };
    for (const auto& [line, described] : cases) {
        programs::TaskSettings task = Unscheduled();
        EXPECT_EQ(Say(line, task), "") << line;
        EXPECT_EQ(DescribeSchedule(task.Info().GetSchedule()), described);
    }
    // What is not said stays, and a count of 0 takes the repeats away.
    programs::TaskSettings task = Unscheduled();
    const std::pair<const char*, const char*> steps[] = {
        {"weekly=sat at=05:00 every=1h times=4", "weekly sat 05:00, 4 more every 1h"},
        {"at=06:00", "weekly sat 06:00, 4 more every 1h"},
        {"every=2h", "weekly sat 06:00, 4 more every 2h"},
        {"monthly=2 times=0", "monthly 2 06:00"},
        {"on-change=", "on change"},
    };
    for (const auto& [line, described] : steps) {
        EXPECT_EQ(Say(line, task), "") << line;
        EXPECT_EQ(DescribeSchedule(task.Info().GetSchedule()), described);
    }
    EXPECT_EQ(task.Info().GetSchedule().GetPeriodSeconds(), 0);
}

TEST(ScheduleWords, FaultsNameTheOption) {
    const std::pair<const char*, const char*> cases[] = {
        {"weekly=mon on-change=", "only one of"},
        {"weekly=mon,,tue", "--weekly: ''"},
        {"weekly=mon\033", "'mon\\033'"},
        {"monthly=0", "--monthly"},
        {"monthly=32", "--monthly"},
        {"yearly=02-30", "--yearly"},
        {"once=2031-02-29", "--once"},
        {"once=1969-12-31", "--once"},
        {"weekly=mon at=24:00", "--at"},
        {"weekly=mon at=+7:00", "--at"},
        {"on-change= every=1h times=2", "go with"},
        {"at=07:00", "go with"},
        {"weekly=mon every=1h", "--every needs --times"},
        {"weekly=mon times=2", "--times needs --every"},
        {"weekly=mon every=0m times=2", "--every"},
        {"weekly=mon every=24h times=1", "--every"},
        {"weekly=mon every=h5m times=1", "--every"},
        {"weekly=mon every=1m times=96", "--times"},
        {"weekly=mon at=23:00 every=30m times=2", "on another day"},
    };
    for (const auto& [line, fault] : cases) {
        programs::TaskSettings task = Unscheduled();
        EXPECT_THAT(Say(line, task), HasSubstr(fault));
        EXPECT_EQ(task.ToMap().toString(), Unscheduled().ToMap().toString());
    }
}

// ---- Rows, files and other people's text ----

TEST(TaskRow, TravelsWholeAndNoTextBreaksOut) {
    programs::TaskRow row;
    row.name = "a\x1f\n";
    row.shares = std::string(100000, 's');
    row.status = 2;
    row.progress = "running 45%";
    row.pending = UINT64_MAX;
    const std::string packed = PackTaskRow(row);
    EXPECT_LT(packed.size(), 65536U);
    programs::TaskRow read;
    ASSERT_TRUE(programs::UnpackTaskRow(packed, read));
    EXPECT_EQ(read.name, "a??");
    EXPECT_EQ(TaskStateWords(read), "running 45%");
    EXPECT_EQ(read.pending, UINT64_MAX);
    EXPECT_FALSE(read.last_end || read.retry_in);
    for (const std::string& bad :
         {std::string(), packed + "x", packed.substr(1000), packed.substr(0, packed.size() - 1)}) {
        EXPECT_FALSE(programs::UnpackTaskRow(bad, read));
    }
}

TEST(TaskRow, AListFitsItsTerminal) {
    programs::TaskRow row;
    row.name = "a task with \xc3\xa4 long name";
    row.shares = "one,two,three,four";
    row.server = "nas.example.org";
    row.schedule = "weekly mon,thu 02:30, 3 more every 1h30m";
    row.status = 2;
    row.result = 2;
    row.last_end = 1000;
    row.next_run = 2100000000;
    row.error = "cannot use server nas.example.org: " + std::string(100, 'x');
    for (const size_t width : {200U, 120U, 80U, 60U}) {
        const auto lines = programs::TaskLines({row}, width);
        ASSERT_EQ(lines.size(), 3U);
        for (const std::string& line : lines) {
            EXPECT_EQ(zelctl::CutToColumns(line, width), line);
        }
        EXPECT_THAT(lines[1], HasSubstr("failed 1970-01-01  2036-07-18"));
        EXPECT_THAT(lines[2], testing::StartsWith("  ! cannot use server nas.example.org: xx"));
    }
    // Where columns are left out, the others have their room.
    EXPECT_THAT(programs::TaskLines({row}, 80)[1],
                testing::StartsWith("a task with ..  weekly mon,th..  running"));
    EXPECT_THAT(programs::TaskLines({row}, 0)[2], testing::EndsWith(row.error));
}

TEST(Text, WhatATerminalObeysIsShownInstead) {
    // Two forms of U+009B, an overlong one, what turns a line around, half a character.
    const std::string hostile = "a\033[2J\xc2\x9b\x9b\xc0\x9b\x7f\xe2\x80\xae\xc3";
    EXPECT_EQ(programs::Printable(hostile),
              "a\\033[2J\\302\\233\\233\\300\\233\\177\\342\\200\\256\\303");
    EXPECT_EQ(programs::PrintableLines("a\x9b\nb\n"), "a\\233\nb\n");
    const std::string plain = "\xc3\xa4 \xe2\x82\xac \xc2\xa0 \xf0\x9f\x98\x80";
    EXPECT_EQ(programs::Printable(plain), plain);
    EXPECT_EQ(programs::JsonText({plain, "\x1b\xc2\x9b\x7f"}),
              "[\n  \"" + plain + "\",\n  \"\\u001b\\u009b\\u007f\"\n]");
    EXPECT_EQ(programs::Shortened(plain + plain, plain.size() + 4),
              plain.substr(0, plain.size() - 4) + " [...]");
    EXPECT_EQ(zelctl::CutToColumns("a\xc3\xa4z", 2), "a\xc3\xa4");
}

PObject SomeTask(const std::string& name, const std::string& share = "b") {
    PObject task = test::FullTask();
    task.asMap().erase("id");
    task["name"] = name;
    task["share_list"].asArray() = {share};
    task["schedule_mode"] = ZEL::SCHD_MODE_WEEKLY;
    task["max_bandwidth"] = INT32_MAX;
    task["exclude"].asArray().emplace_back("*.tmp");
    return task;
}

TEST(TaskFile, EachFaultHasItsPlace) {
    const auto faults = [](const std::string& tasks) {
        return programs::ReadConfiguration(R"({"format":"zelctl tasks","version":1,"tasks":)" +
                                           tasks + "}")
            .faults;
    };
    const std::string good = R"("name":"a","share_list":["x"],"user":"u","server_ip":"1.2.3.4")";
    const std::pair<std::string, const char*> cases[] = {
        {"\n\n[}", "line 3 is no JSON"},
        {"{}", "tasks must be an array"},
        {"[7]", "tasks[0]: must be an object"},
        {"[{" + good + R"(,"colour":1}])", "tasks[0] ('a'): colour is no key"},
        {"[{" + good + R"(,"ssh_port":65536}])", "ssh_port must be a whole number"},
        {"[{" + good + R"(,"ssh_port":-1}])", "ssh_port must be a whole number"},
        {"[{" + good + R"(,"rsync_timeout":599}])", "from 600 to 86400"},
        {"[{" + good + R"(,"exclude":["a",2]}])", "exclude each of its elements must be a text"},
        {"[{" + good + R"(,"pswd":"a\u0000b"}])", "pswd must not hold a zero byte"},
        {"[{" + good + R"(,"pswd":")" + std::string(65536, 'p') + "\"}]", "pswd is too long"},
        {"[{" + good + "},{" + good + "}]", "tasks[1]: a task before has the name 'a'"},
        {R"([{"name":"\u001b","share_list":["x"],"user":"u","server_name":"s"}])",
         "('\\033'): name cannot be '\\033'"},
        {"[{" + good + R"(,"week_schd":"1111112"}])", "week_schd must be seven digits"},
        {"[{" + good + R"(,"ssh":1}])", "ssh must be on or off"},
        {"[{" + good + R"(,"repeat_times_in_day":3}])", "--times go with"},
        {R"([{"name":"b","share_list":["x"],"user":"u"}])", "server_name (--server) is missing"},
    };
    for (const auto& [tasks, fault] : cases) {
        EXPECT_THAT(faults(tasks), ElementsAre(HasSubstr(fault))) << tasks.substr(0, 100);
    }
    EXPECT_THAT(programs::ReadConfiguration("[]").faults, ElementsAre(HasSubstr("format")));
    EXPECT_THAT(programs::ReadConfiguration(R"({"format":"zelctl tasks","version":2})").faults,
                ElementsAre(HasSubstr("version")));
}

TEST(TaskFields, TheDocumentationKnowsEach) {
    const std::string protocol = test::ReadFile(SOURCE_FOLDER "/docs/daemon-protocol.md");
    const std::string manual = test::ReadFile(SOURCE_FOLDER "/packaging/man/zelctl.1");
    for (const programs::TaskField& field : programs::TaskFields()) {
        const std::string row = DocumentedRow(field);
        EXPECT_NE(protocol.find(row + "\n"), std::string::npos) << row;
        if (field.option != nullptr) {
            const std::string option = field.option;
            const std::string name = "Fl -" + option.substr(option.find("--") + 2);
            EXPECT_TRUE(manual.find(name + " ") != std::string::npos ||
                        manual.find(name + "\n") != std::string::npos)
                << name;
        }
    }
}

constexpr char kSamba[] =
    "# Global parameters\r\n[global]\n\tworkgroup = X\n\tpath = /no\n\n"
    "[homes]\n\tbrowseable = No\n[printers]\n\tprintable = Yes\n[print$]\n\tpath = /drivers\n"
    "[HP]\n\tpath = /spool\n\tprint ok = yes\n"
    "no section\n[Photos of us]\n\tcomment = a = b; [x]\n\tpath = \"/srv/my photos\"  \n"
    "[user]\n\tpath = /home/%U\n[off]\n\tavailable = No\n\tPath = /srv\n[nothing]\n[rel]\npath=x\n"
    "[]\npath = /y\n[open\npath = /z";

TEST(Samba, SharesAreFoundAmongAllElse) {
    std::vector<std::string> found;
    for (const zelctl::SambaShare& share : zelctl::ParseSambaShares(kSamba)) {
        found.push_back(share.name + "|" + share.path + "|" + share.refusal.substr(0, 12));
    }
    EXPECT_THAT(found, ElementsAre("Photos of us|/srv/my photos|", "user|/home/%U|its folder /",
                                   "off|/srv|Samba has it", "nothing||it names no ",
                                   HasSubstr("rel|x|its")));
}

TEST(Doctor, TellsAnRsyncThatIsTooOld) {
    std::string version;
    for (const char* usable : {"3.2.1  protocol version 31\n", "v4.0dev  pro", "3.10.0pre1  pro"}) {
        EXPECT_TRUE(zelctl::IsUsableRsync("rsync  version " + std::string(usable), version));
    }
    EXPECT_EQ(version, "3.10.0pre1");
    for (const char* other : {"rsync  version 3.2.0  pro", "openrsync: protocol version 29", ""}) {
        EXPECT_FALSE(zelctl::IsUsableRsync(other, version)) << other;
    }
}

// ---- The commands, against a daemon that is ours ----

/// Listens where the daemon would, notes the requests and answers by a function. A reply that is an
/// array is sent element after element; the connection is closed when it ends in null.
class FakeDaemon {
public:
    using Answer = std::function<PObject(const PObject& request)>;

    FakeDaemon(const std::string& root, Answer answer) : answer_(std::move(answer)) {
        fs::create_directories(root + "/var/run");
        EXPECT_EQ(listener_.prepare(root + "/var/run/zel_daemon.sock"), 0);
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
        ZEL::IPCSender peer;
        peer.assign(fd);
        for (bool open = true; open;) {
            PObject request;
            if (peer.recv(request) != 0) {
                return;
            }
            {
                const std::lock_guard<std::mutex> lock(mutex_);
                requests_.push_back(request.toString());
            }
            const PObject reply = answer_(request);
            if (!reply.isArray()) {
                peer.send(reply);
            }
            for (const PObject& element : reply.asArray()) {
                open = open && !element.isNull() && peer.send(element) == 0;
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

PObject Replies(std::initializer_list<PObject> replies) {
    PObject all;
    all.asArray() = replies;
    return all;
}

// A reply of `watch` or `task_list`.
PObject TasksReply(const std::vector<PObject>& tasks) {
    PObject reply = Success();
    reply["tasks"].asArray() = tasks;
    return reply;
}

// A task as the daemon tells it in brief.
PObject Brief(const std::string& name, int status, int result, int last_run,
              const programs::TaskRow& more = {}) {
    programs::TaskRow row = more;
    row.name = name;
    row.schedule = "daily 02:30";
    row.status = status;
    row.result = result;
    row.last_end = 1065;
    PObject task;
    task = PObject::Map{{"name", name},          {"row", PackTaskRow(row)}, {"status", status},
                        {"sync_result", result}, {"last_run", last_run},    {"last_start", 1000},
                        {"last_end", 1065},      {"schedule", row.schedule}};
    return task;
}

class Zelctl : public testing::Test {
protected:
    Zelctl() {
        root_.Write("source/file", "x");
        root_.Write("password", "top secret\n");
        test::Must(Run("share add docs " + root_.Path("source")));
    }

    Outcome Run(const std::string& arguments, const std::string& input = "") const {
        return test::Zelctl(root_.Path(), arguments, input);
    }
    Outcome Add(const std::string& more) const {
        return Run(
            "task add nightly --no-check --share docs --server nas2 --user alice --password-file " +
            root_.Path("password") + " " + more);
    }

    const test::TempRoot root_;
};

TEST_F(Zelctl, WithoutADaemonEveryCommandSaysWhatToDo) {
    for (const char* command : {"task list", "task run a", "status", "task watch"}) {
        EXPECT_THAT(Run(command), Ended(3, "systemctl start zel_daemon")) << command;
    }
    EXPECT_THAT(Run("task lost").output, HasSubstr("no command 'task lost'"));
    EXPECT_EQ(Run("task show").exit_code, 2);
}

TEST_F(Zelctl, HelpIsForPeopleAndFitsATerminal) {
    for (const char* command :
         {"", "task", "task add", "task edit", "task log", "task next", "task run", "share",
          "share import", "trust", "push", "pair check", "next", "export", "import", "doctor",
          "server", "server setup", "server account add"}) {
        const Outcome help = Run(std::string("help ") + command);
        EXPECT_THAT(help, Ended(0, "Usage:")) << command;
        EXPECT_THAT(help.output, Not(testing::ContainsRegex("[{}]|TEXT|INT|REQUIRED|[^\n]{81}")));
    }
    EXPECT_THAT(Run("task next x --count 0"), Ended(2, "from 1 to 1000, not '0'"));
    EXPECT_THAT(Run("task add x --share"), Ended(2, "--share needs a value"));
    EXPECT_THAT(Run("task rm x y"), Ended(2, "one word too many: 'y'"));
}

TEST_F(Zelctl, AShareThatTheDaemonSeesOtherwiseIsNotAdded) {
    root_.Write("other/file", "x");
    FakeDaemon daemon(root_.Path(), [](const PObject&) {
        return Success({{"problem", PObject("it sees another folder there")}});
    });
    EXPECT_THAT(Run("share add other " + root_.Path("other")), Ended(3, "another folder there"));
    EXPECT_THAT(Run("share list").output, Not(HasSubstr("other")));
}

TEST_F(Zelctl, AddSendsAWholeTaskAndShowsItsRunsButNeverThePassword) {
    FakeDaemon daemon(root_.Path(), [](const PObject& request) {
        return Success({{"task", request}});
    });
    EXPECT_THAT(Add("--weekly daily --at 08:00 --every 2h --times 3 --plain "
                    "--exclude '*.tmp' --exclude 'a b'")
                    .output,
                AllOf(HasSubstr("'nightly' is added: daily 08:00, 3 more every 2h"),
                      testing::ContainsRegex("(20[0-9-]* [01][0-9]:00:00\n){3}"),
                      Not(HasSubstr("secret"))));
    EXPECT_THAT(
        daemon.Requests(),
        ElementsAre(AllOf(HasSubstr("\"exclude\": [\"*.tmp\", \"a b\"]"), Not(HasSubstr("\"id\"")),
                          HasSubstr("\"pswd\": \"top secret\""), Not(HasSubstr("\"ssh\"")),
                          HasSubstr("\"week_schd\": \"1111111\""))));
    EXPECT_THAT(Run("task add a --share docs -s nas2 -u alice").output,
                HasSubstr("no password: give --password-file"));
    // What cannot be is told before anything is sent.
    const std::pair<std::string, const char*> refused[] = {
        {"--once 2001-01-01", "lies in the past"},
        {"--share none", "share 'none'"},
        {"--share docs", "names share 'docs' twice"},
        {"--exclude " + std::string(65536, 'x'), "(--exclude) each of its elements is too long"},
        {"--password hunter2", "no option '--password'"},
    };
    for (const auto& [more, text] : refused) {
        EXPECT_THAT(Add(more), AllOf(Not(Ended(0)), Field(&Outcome::output, HasSubstr(text))));
    }
    EXPECT_EQ(daemon.Requests().size(), 1U);
}

TEST_F(Zelctl, EditSendsOnlyWhatIsSaid) {
    bool changed = true;
    FakeDaemon daemon(root_.Path(), [&](const PObject&) {
        return Success({{"task", SomeTask("nightly")}, {"changed", changed}});
    });
    EXPECT_THAT(
        Run("task edit nightly --at 09:00 --no-ssh --plain --server 10.0.0.1 --rename daily "
            "--user lena --no-exclude"),
        Ended(0));
    // The password is asked for with what the task is otherwise.
    EXPECT_THAT(Run("task edit nightly --no-check --bwlimit else=7,22:00-06:00=0 --password-file " +
                    root_.Path("password")),
                Ended(0));
    changed = false;
    EXPECT_THAT(Run("task edit nightly --on-change").output, HasSubstr("already"));
    EXPECT_THAT(Run("task edit nightly --once 2001-01-01").output, HasSubstr("lies in the past"));
    EXPECT_THAT(
        daemon.Requests(),
        ElementsAre("{\"command\": \"task_edit\", \"exclude\": [], \"name\": \"daily\", "
                    "\"schedule_begin_hour\": 9, \"schedule_begin_min\": 0, \"server_ip\": "
                    "\"10.0.0.1\", \"server_name\": \"\", \"ssh\": 0, \"task\": \"nightly\", "
                    "\"user\": \"lena\"}",
                    HasSubstr("task_show"),
                    "{\"bandwidth_windows\": \"22:00-06:00=0\", \"command\": \"task_edit\", "
                    "\"max_bandwidth\": 7, \"pswd\": \"top secret\", \"task\": \"nightly\"}",
                    HasSubstr("\"schedule_mode\": 1"), HasSubstr("task_show")));
}

TEST_F(Zelctl, AShareThatTasksSendIsNotRemovedUnasked) {
    FakeDaemon daemon(root_.Path(), [](const PObject&) {
        return TasksReply({SomeTask("nightly", "docs"), SomeTask("other")});
    });
    EXPECT_THAT(Run("share rm docs"), Ended(3, "sent by task nightly:"));
    EXPECT_THAT(Run("share list").output, HasSubstr("docs"));
    EXPECT_THAT(Run("share rm docs --force"), Ended(0));
}

TEST_F(Zelctl, ErrorRepliesBecomeWordsAndExitCodes) {
    PObject reply;
    FakeDaemon daemon(root_.Path(), [&](const PObject&) { return reply; });
    for (const auto& [code, exit_code] :
         {std::pair{-4, 2}, {-8, 3}, {-11, 3}, {-17, 3}, {-19, 3}, {-3, 3}}) {
        reply = PObject::Map{{"result", code}, {"error", "no task \033[31m'x'"}};
        EXPECT_THAT(Run("task rm x"), Ended(exit_code, "zelctl: no task \\033[31m'x'\n")) << code;
    }
    reply = "no map";
    EXPECT_THAT(Run("task list").output, HasSubstr("is no reply"));
}

TEST_F(Zelctl, NothingInAListReachesTheTerminal) {
    programs::TaskRow row;
    row.name = "bad\302\233]0;x";
    row.note = "disk\302\233 full";
    row.error = "no disk";
    PObject rows;
    rows.asArray().emplace_back(PackTaskRow(row));
    FakeDaemon daemon(root_.Path(), [&](const PObject& request) {
        return request.hasMember("rows") ? Success({{"rows", rows}})
                                         : TasksReply({Brief("bad\033]0;x\007", 0, 2, 4)});
    });
    for (const char* list : {"task list", "-v task list"}) {
        EXPECT_THAT(Run(list).output, AllOf(HasSubstr("NAME"), HasSubstr("bad\\302\\233]0;x  "),
                                            HasSubstr("\n  ! no disk\n  ! disk\\302\\233 full\n")));
    }
    EXPECT_EQ(nlohmann::json::parse(Run("task list --json").output)[0]["name"], "bad\033]0;x\007");
    rows.asArray().emplace_back("no row");
    EXPECT_THAT(Run("task list"), Ended(3, "of one version?"));
}

TEST_F(Zelctl, RunWaitsForItsOwnRunAndExitsByItsResult) {
    int result = 1;
    FakeDaemon daemon(root_.Path(), [&](const PObject& request) {
        if (request["command"].asString() != "watch") {
            return Success({{"after", 6}});
        }
        // The run before this one failed; that is not what is waited for.
        PObject ended = Brief("a", 0, result, 7);
        ended["last_status"] = result == 2 ? 11 : 0;
        ended["last_error"] = "No space left in /copies";
        return Replies({TasksReply({Brief("a", 1, 2, 6)}), TasksReply({Brief("a", 2, 2, 6)}),
                        TasksReply({ended}), PObject()});
    });
    EXPECT_EQ(Run("task run a").exit_code, 0);
    EXPECT_THAT(Run("task run a --wait"), Ended(0, "a: done in 1:05"));
    result = 2;
    EXPECT_THAT(Run("task run a --wait"), Ended(1, "No space left in /copies"));
    result = 3;
    EXPECT_EQ(Run("task run a -w").exit_code, 5);
    EXPECT_EQ(Run("task run a b -w").exit_code, 5) << "b has gone";
}

TEST_F(Zelctl, AnInterruptLeavesTheRunGoing) {
    FakeDaemon daemon(root_.Path(), [&](const PObject& request) {
        return request["command"].asString() == "watch" ? TasksReply({Brief("a", 2, 0, 6)})
                                                        : Success({{"after", 6}});
    });
    // The shell sends the interrupt to the very process that it becomes.
    EXPECT_THAT(test::Zelctl(root_.Path(), "task run a --wait", "", "(sleep 1; kill -INT $$) & "),
                Ended(5, "the run of 'a' goes on"));
    EXPECT_THAT(daemon.Requests(), ElementsAre(HasSubstr("task_run"), HasSubstr("watch")));
}

TEST_F(Zelctl, WatchingAPipeTellsEachChangeOnce) {
    FakeDaemon daemon(root_.Path(), [](const PObject&) {
        return Replies({TasksReply({Brief("a", 0, 1, 1)}), TasksReply({Brief("a", 0, 1, 1)}),
                        TasksReply({Brief("a", 1, 1, 1)}), PObject()});
    });
    const Outcome outcome = Run("task watch a");
    EXPECT_EQ(outcome.exit_code, 3) << "the daemon broke off";
    EXPECT_THAT(outcome.output, testing::ContainsRegex("a: idle.*\n.*a: waiting.*\n"));
    EXPECT_EQ(std::count(outcome.output.begin(), outcome.output.end(), '\n'), 3);
}

TEST_F(Zelctl, ATerminalIsDrawnInPlaceWithinItsWindowAndLeftAsItWas) {
    FakeDaemon daemon(root_.Path(), [](const PObject& request) {
        std::vector<PObject> tasks;
        for (int i = 0; i < 30; ++i) {
            tasks.push_back(Brief("idle" + std::to_string(i), 0, 1, 1));
        }
        tasks.push_back(Brief("busy\t", 2, 1, 1));
        TARQ::Backup::RunProgress progress;
        progress.percent_of = TARQ::Backup::RunProgress::BYTES;
        progress.percent = 40;
        programs::AddProgress("docs", progress, tasks.back());
        return request["command"].asString() == "watch"
                   ? Replies({TasksReply(tasks), TasksReply(tasks)})
                   : Success({{"after", 1}});
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
        AllOf(HasSubstr("NAME"), HasSubstr("busy?"), HasSubstr("idle1"), Not(HasSubstr("idle2")),
              HasSubstr("and 28 lines more"), Not(HasSubstr("PENDING"))));
    EXPECT_THAT(watched, AllOf(HasSubstr("\033[?25l"), testing::EndsWith("\033[?25h")));
    EXPECT_THAT(on_terminal("run \"$(printf 'busy\\t')\" --wait"),
                AllOf(HasSubstr("docs [###.....] 40%"), HasSubstr("goes on")));
}

TEST_F(Zelctl, EachVerbAsksForWhatItSaysAndShowsTheAnswer) {
    PObject task = SomeTask("t");
    task["status"] = 2;
    task["run"] = 9;
    TARQ::Backup::RunProgress progress;
    progress.percent_of = TARQ::Backup::RunProgress::BYTES;
    progress.percent = 50;
    progress.bytes_done = 1048576;
    progress.bytes_per_second = 104857;
    programs::AddProgress("docs", progress, task);
    PObject run;
    run = PObject::Map{{"run", 9},           {"start", 1000},
                       {"end", 1100},        {"sync_result", 2},
                       {"reason", "retry"},  {"files_sent", 3},
                       {"bytes_sent", 2048}, {"error", "first\nsecond\033"}};
    PObject runs;
    runs.asArray() = {run};
    FakeDaemon daemon(root_.Path(), [&](const PObject&) {
        return Success({{"task", task}, {"runs", runs}, {"version", "1.2"}, {"workers", 2}});
    });
    const struct {
        const char* arguments;
        const char* request;
        const char* shown;
    } cases[] = {
        {"task rm t", R"("task_remove", "task": "t")", "is removed"},
        {"task cancel t", R"("task_cancel", "task": "t")", "does not run"},
        {"task pause t", R"("task_pause", "task": "t")", "is paused"},
        {"task resume t", R"("task_resume", "task": "t")", "runs by its"},
        {"task show t", R"("task_show", "task": "t")",
         "progress         docs: 50%  1.0 MiB, 102 KiB/s, 0:09 left"},
        {"task show t --json", R"("task_show", "task": "t")", "\"state\": \"running\""},
        {"task next t --count 5 --json", R"("task_show", "task": "t")", "13:00:00"},
        {"task log t --limit 7", R"("task_log", "details": 0, "limit": 7, "task": "t")",
         "1:40  failed  retry   3      0        2.0 KiB  first; second\\033"},
        {"task log t --json", R"("task_log", "details": 0, "limit": 20, "task": "t")",
         "\"result\": \"failed\""},
        {"status", R"("daemon_status")", "0, 0 running (2 workers)"},
        {"reload", R"("reload")", "has read"},
    };
    for (const auto& [arguments, request, shown] : cases) {
        const Outcome outcome = Run(arguments);
        EXPECT_THAT(outcome, Ended(0, shown)) << arguments;
        EXPECT_THAT(outcome.output, Not(HasSubstr("secret")));
        EXPECT_EQ(daemon.Requests().back(), "{\"command\": " + std::string(request) + "}");
    }
}

// ---- With a real server ----

class RealServer : public testing::Test, public test::ClientAndServer {};

TEST_F(RealServer, TheServerIsAskedBeforeATaskIsAddedAndByTheDoctor) {
    PObject added;
    FakeDaemon daemon(folder_.Path("client"), [&](const PObject& request) {
        if (request["command"].asString() == "task_list") {
            PObject wrong = added;
            wrong["name"] = "wrong";
            wrong["pswd"] = "other";
            return TasksReply({added, wrong});
        }
        if (request["command"].asString() == "task_add") {
            added = request;
        }
        return Success({{"task", request}, {"protocol", 1}});
    });
    const std::string add =
        "task add t --share docs -u alice --manual --password-file - -s 127.0.0.1";
    EXPECT_THAT(Client(add, "wrong\n"), Ended(4, "refused the login"));
    EXPECT_THAT(daemon.Requests(), testing::IsEmpty());
    EXPECT_THAT(Client(add, "secret words\n"), Ended(0, "takes the account and the shares"));
    const Outcome doctor = Client("doctor");
    EXPECT_THAT(doctor.output,
                AllOf(testing::ContainsRegex("ok +task t: .*the server takes it"),
                      HasSubstr("answers: plain, within this machine"),
                      testing::ContainsRegex("failed +task wrong: .*refused the login")));
    EXPECT_THAT(Client("push docs -s 127.0.0.1 -u alice --password-file -", "wrong\n"), Ended(4));
    const std::string other = "SHA256:" + std::string(43, 'A');
    const std::string servers = "client/usr/tarq/etc/tarqrsync_servers";
    folder_.Write(servers, "[127.0.0.1]\ntransport=\"tls\"\nport=\"" + std::to_string(tls_port_) +
                               "\"\nfingerprint=\"" + other + "\"\n");
    EXPECT_THAT(Client("doctor").output,
                AllOf(testing::ContainsRegex("failed +server .*and " + other + " is trusted"),
                      HasSubstr("-> somebody may be in between")));
    folder_.Write(servers, "[127.0.0.1\n");
    EXPECT_THAT(Client("doctor").output,
                testing::ContainsRegex("failed +trusted servers: .*line 1"));
    fs::remove(folder_.Path(servers));
    StopServer();
    EXPECT_THAT(Client(add, "secret words\n"), Ended(0, "the task is added all the same"));
}

TEST_F(Zelctl, ExportAndImportTakeAllAlongAndFaultsAddNothing) {
    std::vector<PObject> there = {SomeTask("\xc3\xa4 x", "docs")};
    PObject added = there[0];
    added["command"] = "task_add";
    added["block"] = 0;
    added["compare_days"] = 7;
    added["verify_days"] = 30;
    added["bandwidth_windows"] = "";
    added["brake"] = 50;
    there[0]["id"] = 5;
    there[0]["last_error"] = "not part of it";
    test::Must(Run("trust cellar --plain"));
    FakeDaemon daemon(root_.Path(), [&](const PObject& request) {
        return request["command"].asString() == "task_list" ? TasksReply(there) : Success();
    });
    const std::string file = root_.Path("tasks.json");
    EXPECT_EQ(Run("export --with-passwords").exit_code, 2);
    EXPECT_EQ(Run("export --with-passwords " + file).exit_code, 0);
    EXPECT_EQ(test::ModeOf(file), 0600U);
    EXPECT_THAT(Run("import " + file).output, HasSubstr("--replace"));
    EXPECT_EQ(Run("import --replace " + file).exit_code, 0);
    EXPECT_THAT(daemon.Requests().back(),
                AllOf(HasSubstr("task_edit"), HasSubstr("\"pswd\": \"secret words\"")));
    there.clear();
    EXPECT_EQ(Run("import " + file).exit_code, 0);
    EXPECT_EQ(daemon.Requests().back(), added.toString());
    // The second task cannot be: the first is not added either.
    const PObject bad = SomeTask("b", "none");
    const PObject good = SomeTask("c", "docs");
    root_.Write("tasks.json", programs::WriteConfiguration({good, bad}, {}, true));
    EXPECT_THAT(Run("import " + file).output,
                AllOf(HasSubstr("share 'none'"), HasSubstr("nothing was imported")));
    EXPECT_THAT(daemon.Requests().back(), HasSubstr("task_list"));
    // Passwords that are missing come from elsewhere, or nothing happens.
    root_.Write("tasks.json", programs::WriteConfiguration({good}, {}, false));
    EXPECT_THAT(test::ReadFile(file), Not(HasSubstr("secret")));
    EXPECT_EQ(Run("import " + file).exit_code, 2);
    EXPECT_EQ(Run("import --password-file - " + file, "pw\n").exit_code, 0);
    EXPECT_THAT(daemon.Requests().back(), HasSubstr("\"pswd\": \"pw\""));
}

TEST_F(Zelctl, SambaSharesAreTakenOverOnce) {
    if (zelctl::FindInPath("testparm").empty()) {
        GTEST_SKIP() << "needs testparm";
    }
    root_.Write("photos/file", "x");
    const std::string config = root_.Write(
        "smb.conf", "[global]\nworkgroup = X\n[Photos]\npath = " + root_.Path("photos") +
                        "\n[docs]\npath = " + root_.Path("source") +
                        "\n[gone]\npath = /no/such\n[again]\npath = " + root_.Path("photos") +
                        "\n");
    const std::string import = "share import --samba --config ";
    EXPECT_THAT(
        Run(import + config + " -n").output,
        AllOf(HasSubstr("'Photos' would be /"), HasSubstr("'docs' is in"),
              HasSubstr("'gone' would be left out"), HasSubstr("'again' would be left out: ")));
    EXPECT_THAT(Run("share list").output, Not(HasSubstr("Photos"))) << "nothing was done";
    EXPECT_EQ(Run(import + config + " photos").exit_code, 0);
    EXPECT_THAT(test::ReadFile(root_.Path("usr/tarq/etc/tarqshare.conf")), HasSubstr("[Photos]"));
    EXPECT_THAT(Run("share list").output, Not(HasSubstr("gone")));
    EXPECT_THAT(Run(import + "/no/such").output, HasSubstr("testparm cannot read"));
}

TEST_F(Zelctl, TheDoctorFindsWhatIsWrongAndHowToMendIt) {
    const int port = test::FreePort();
    FakeDaemon daemon(root_.Path(), [&](const PObject&) {
        PObject task = SomeTask("nightly");
        task["sync_result"] = 2;
        task["last_error"] = "no disk";
        task["watched_folders"] = 0;
        task["watch_complete"] = 0;
        task["watch_problem"] = "not permitted";
        task["share_list"].asArray().emplace_back("docs");
        task["server_name"] = "";
        task["server_ip"] = "127.0.0.1";
        task["ssh_port"] = port;
        PObject reply = TasksReply({task});
        reply["protocol"] = 1;
        reply["folders"] = 7;
        reply["store"] = root_.Write("store/tasks.db", "");
        return reply;
    });
    root_.Write("usr/tarq/etc/zel_daemon.conf", "[daemon]\nworkers=\"99\"\n");
    root_.Write("usr/tarq/etc/tarqrsync.conf", "[rsync]\nport=\"no\"\n");
    chmod(root_.Path("usr/tarq/etc/tarqshare.conf").c_str(), 0666);
    const Outcome outcome = Run("doctor --json");
    EXPECT_EQ(outcome.exit_code, 3);
    std::map<std::string, std::string> found;
    for (const auto& check : nlohmann::json::parse(outcome.output)) {
        found[check["name"]] +=
            check["verdict"].get<std::string>() + ": " + check["finding"].get<std::string>();
        EXPECT_EQ(check["verdict"] == "ok", check["remedy"] == "") << check;
    }
    EXPECT_THAT(found["rsync"], HasSubstr("ok: version 3"));
    EXPECT_THAT(found["share docs"], HasSubstr("ok: ready (task nightly)"));
    EXPECT_THAT(found["share b"], HasSubstr("failed: "));
    EXPECT_THAT(found["file " + root_.Path("usr/tarq/etc/tarqshare.conf")], HasSubstr("0666"));
    EXPECT_THAT(found["file " + root_.Path("store/tasks.db")], HasSubstr("holds secrets"));
    EXPECT_THAT(found["task nightly"],
                AllOf(HasSubstr("failed: nothing of it is watched: not permitted"),
                      HasSubstr("failed: its last run failed at "), HasSubstr("no disk")));
    EXPECT_THAT(found["configuration"],
                AllOf(HasSubstr("workers is '99'"), HasSubstr("port is 'no'")));
    EXPECT_THAT(found["store"], HasSubstr("is empty"));
    EXPECT_THAT(found["watches"], HasSubstr("7 folders watched"));
    EXPECT_THAT(found["unit zel_daemon"], HasSubstr("failed: it is not installed"));
    EXPECT_THAT(found["server 127.0.0.1, port " + std::to_string(port)], HasSubstr("refused"));
}

}  // namespace

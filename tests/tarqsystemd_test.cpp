#include <systemd/sd-bus.h>
#include <tarq/core.h>
#include <tarq/systemd.h>

#include "platform/tarqsystemd/bus_units.h"
#include "tests/support/testing.h"

namespace {

using tarq_systemd::Outcome;
using tarq_systemd::Status;

bool ComesTrue(const std::function<bool()>& condition) {
    for (int i = 0; i < 1000 && !condition(); ++i) {
        usleep(10'000);
    }
    return condition();
}

// ---- Below a root folder: the supervisor ----

class Supervised : public testing::Test {
protected:
    ~Supervised() override { TARQSystemdStop("unit"); }

    void Configure(const std::string& command, const std::string& more = "") const {
        root_.Write("usr/tarq/etc/tarqsystemd.conf",
                    "[unit]\ncommand=\"" + command + "\"\n" + more);
    }
    void ConfigureScript(const std::string& script, const std::string& more = "") const {
        Configure("/bin/sh '" + root_.Write("a script.sh", script) + "'", more);
    }
    /// What a script writes, once it has.
    std::string WaitForText(const std::string& name) const {
        ComesTrue([&] { return !test::ReadFile(root_.Path(name)).empty(); });
        return test::ReadFile(root_.Path(name));
    }

    const test::TempRoot root_;
    const std::string pid_file_ = root_.Path("var/run/unit.pid");
};

TEST_F(Supervised, UnitIsStartedOnceAndStopped) {
    ConfigureScript(
        "echo x >> $TARQ_ROOT/starts\ntrap 'echo ended > $TARQ_ROOT/end; exit 0' TERM\n"
        "ls /proc/self/fd | wc -l > $TARQ_ROOT/ready\nwhile :; do sleep 0.05; done\n");
    const int leaked = dup(STDERR_FILENO);
    std::vector<std::thread> starters(4);
    for (std::thread& starter : starters) {
        starter = std::thread([] { EXPECT_EQ(TARQSystemdStart("unit"), 1); });
    }
    for (std::thread& starter : starters) {
        starter.join();
    }
    close(leaked);
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 1);
    const pid_t pid = atoi(test::ReadFile(pid_file_).c_str());
    EXPECT_NE(getsid(pid), getsid(0));
    EXPECT_EQ(waitpid(pid, nullptr, WNOHANG), -1) << "the command is nobody's child here";
    EXPECT_EQ(WaitForText("ready"), "4\n") << "the standard streams, and the folder that ls reads";

    EXPECT_EQ(TARQSystemdStop("unit"), 1);
    EXPECT_EQ(test::ReadFile(root_.Path("end")), "ended\n");
    EXPECT_EQ(test::ReadFile(root_.Path("starts")), "x\n");
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 0);
    EXPECT_EQ(TARQSystemdStop("unit"), 1);
}

TEST_F(Supervised, UnitThatIgnoresTheRequestIsKilledWithItsChildren) {
    ConfigureScript(
        "trap '' TERM\nsleep 1000 &\necho $! > $TARQ_ROOT/ready\nwait\nwhile :; do sleep 1; done\n",
        "stop_seconds=\"0\"\n");
    ASSERT_EQ(TARQSystemdStart("unit"), 1);
    const int child = atoi(WaitForText("ready").c_str());
    ASSERT_GT(child, 0);
    EXPECT_EQ(TARQSystemdStop("unit"), 1);
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 0);
    const std::string stat = "/proc/" + std::to_string(child) + "/stat";
    EXPECT_TRUE(ComesTrue([&] {
        return !fs::exists(stat) || test::ReadFile(stat).find(") Z ") != std::string::npos;
    }));
}

TEST_F(Supervised, ProcessThatOnlyHasTheNumberIsNotTheUnit) {
    const pid_t stranger = fork();
    if (stranger == 0) {
        pause();
        _exit(0);
    }
    for (const std::string start_time : {"\n12345\n", "\n", " x"}) {
        root_.Write("var/run/unit.pid", std::to_string(stranger) + start_time);
        EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 0) << start_time;
        EXPECT_EQ(TARQSystemdStop("unit"), 1);
        EXPECT_EQ(waitpid(stranger, nullptr, WNOHANG), 0) << "it was not ours to end";
    }
    kill(stranger, SIGKILL);
    waitpid(stranger, nullptr, 0);
}

TEST_F(Supervised, CommandThatCannotRunIsAnErrorAndLeavesNothing) {
    EXPECT_EQ(TARQSystemdStart("unit"), 0);
    EXPECT_EQ(KAPICErrGet(), TARQ_ERR_NO_SECTION);
    const std::pair<const char*, int> commands[] = {{"/nowhere/zel_daemon", TARQ_ERR_SERVICE},
                                                    {"/etc/passwd", TARQ_ERR_SERVICE},
                                                    {"sleep 1000", TARQ_ERR_BAD_PARAMETER},
                                                    {"/bin/sleep '1000", TARQ_ERR_BAD_PARAMETER},
                                                    {"", TARQ_ERR_BAD_PARAMETER}};
    for (const auto& [command, code] : commands) {
        Configure(command);
        EXPECT_EQ(TARQSystemdStart("unit"), 0) << command;
        EXPECT_EQ(KAPICErrGet(), code) << command;
        EXPECT_FALSE(fs::exists(pid_file_)) << command;
    }
}

TEST_F(Supervised, NamesThatCouldLeadElsewhereAreRefused) {
    const std::string too_long(201, 'u');
    for (const char* name : {"", "../unit", ".unit", "a]b", "a\nb", too_long.c_str()}) {
        EXPECT_LT(TARQSystemdActiveStatusGet(name), 0) << name;
        EXPECT_EQ(TARQSystemdStart(name) + TARQSystemdStop(name), 0) << name;
        EXPECT_EQ(KAPICErrGet(), TARQ_ERR_BAD_PARAMETER);
    }
}

// ---- Where the system manager runs ----

/// Answers what it was told to.
struct FakeBus : tarq_systemd::ManagerBus {
    int GetState(const std::string& unit, tarq_systemd::UnitState* state) override {
        asked += unit + " ";
        *state = current;
        return state_error;
    }
    int RunJob(const char* method, const std::string& unit, std::chrono::seconds,
               std::string* result) override {
        asked += method + (" " + unit + " ");
        *result = job_result;
        return job_error;
    }

    tarq_systemd::UnitState current;
    std::string job_result, asked;
    int state_error = 0, job_error = 0;
};

TEST(OnTheBus, StatesAndTheEndsOfJobsDecide) {
    auto* bus = new FakeBus;
    tarq_systemd::BusUnits units{std::unique_ptr<FakeBus>(bus)};
    constexpr auto kDone = Outcome::kDone;
    constexpr auto kFailed = Outcome::kFailed;
    for (const auto& [state, job_result, job_error, active, start, stop] : std::initializer_list<
             std::tuple<tarq_systemd::UnitState, const char*, int, bool, Outcome, Outcome>>{
             {{"active", ""}, "done", 0, true, kDone, kDone},
             {{"reloading", ""}, "failed", 0, true, kFailed, kFailed},
             {{"activating", "auto-restart"}, "", -EACCES, false, kFailed, kFailed},
             {{"activating", "start"}, "done", 0, false, Outcome::kBusy, kDone},
             // The manager knows no such unit: it is stopped well enough.
             {{"inactive", ""}, "", -EIO, false, kFailed, kDone},
         }) {
        SCOPED_TRACE(state.active + state.sub);
        bus->current = state;
        bus->job_result = job_result;
        bus->job_error = job_error;
        EXPECT_EQ(units.StatusOf("unit"), active ? Status::kActive : Status::kInactive);
        EXPECT_EQ(units.Stop("unit"), stop);
        bus->asked.clear();
        EXPECT_EQ(units.Start("unit"), start);
        EXPECT_EQ(bus->asked == "unit.service ", start == Outcome::kBusy) << bus->asked;
        EXPECT_TRUE(start != kFailed || errno == (job_error < 0 ? -job_error : EIO));
    }
    bus->state_error = -ECONNREFUSED;
    bus->asked.clear();
    EXPECT_EQ(units.StatusOf("ready.target"), Status::kUnknown);
    EXPECT_EQ(errno, ECONNREFUSED);
    EXPECT_EQ(units.Stop("unit"), kFailed);
    EXPECT_EQ(bus->asked, "ready.target StopUnit unit.service unit.service ");
    EXPECT_EQ(tarq_systemd::BusUnits(nullptr).StatusOf("unit"), Status::kUnknown);
}

/// A manager. Announces the end of a job before it answers the call that queues it, as the true one
/// may do.
int Answer(sd_bus_message* call, void* subscribed, sd_bus_error* error) {
    const std::string method = sd_bus_message_get_member(call);
    const char *name = "", *property = "";
    sd_bus_message_read(call, "s", &name);
    if (method == "Subscribe") {
        *static_cast<bool*>(subscribed) = true;
        return sd_bus_reply_method_return(call, "");
    }
    if (method == "LoadUnit") {
        return sd_bus_reply_method_return(call, "o", "/unit");
    }
    if (method == "Get") {
        sd_bus_message_read(call, "s", &property);
        return sd_bus_reply_method_return(call, "v", "s", property);
    }
    if (method + name != "StartUnitunit.service") {
        return sd_bus_error_set(error, SD_BUS_ERROR_ACCESS_DENIED, "no");
    }
    for (const auto& [job, end] : {std::pair("/job/6", "failed"), std::pair("/job/7", "done")}) {
        if (*static_cast<bool*>(subscribed)) {
            sd_bus_emit_signal(sd_bus_message_get_bus(call), "/org/freedesktop/systemd1",
                               "org.freedesktop.systemd1.Manager", "JobRemoved", "uoss", 1U, job,
                               name, end);
        }
    }
    return sd_bus_reply_method_return(call, "o", "/job/7");
}

TEST(ManagerBus, RunsJobsOfAManagerOnARealBus) {
    const test::TempFolder folder;
    const std::string address = "unix:path=" + folder.Path("bus");
    setenv("DBUS_SYSTEM_BUS_ADDRESS", address.c_str(), 1);
    EXPECT_FALSE(tarq_systemd::ConnectManagerBus()) << "without a bus";
    const std::string run_bus = "dbus-daemon --session --fork --print-pid=1 --address=" + address;
    if (system((run_bus + " >" + folder.Path("pid")).c_str()) != 0) {
        GTEST_SKIP() << "no dbus-daemon here";
    }
    const pid_t daemon = atoi(test::ReadFile(folder.Path("pid")).c_str());
    ASSERT_GT(daemon, 0);
    sd_bus* server = nullptr;
    bool subscribed = false;
    EXPECT_GE(sd_bus_open_system(&server), 0);
    sd_bus_add_fallback(server, nullptr, "/", Answer, &subscribed);
    EXPECT_GE(sd_bus_request_name(server, "org.freedesktop.systemd1", 0), 0);
    std::atomic<bool> stop{false};
    std::thread serving([&] {
        while (!stop) {
            if (sd_bus_process(server, nullptr) == 0) {
                sd_bus_wait(server, 10'000);
            }
        }
    });

    if (const auto bus = tarq_systemd::ConnectManagerBus()) {
        tarq_systemd::UnitState state;
        std::string end;
        EXPECT_EQ(bus->GetState("unit.service", &state), 0);
        EXPECT_EQ(state.active + "/" + state.sub, "ActiveState/SubState");
        EXPECT_EQ(bus->RunJob("StartUnit", "unit.service", std::chrono::seconds(20), &end), 0);
        EXPECT_EQ(end, "done");
        EXPECT_EQ(bus->RunJob("StartUnit", "other", std::chrono::seconds(20), &end), -EACCES);
    } else {
        ADD_FAILURE() << "no connection";
    }
    stop = true;
    serving.join();
    sd_bus_unref(server);
    kill(daemon, SIGTERM);
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
}

}  // namespace

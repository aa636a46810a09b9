#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <systemd/sd-bus.h>
#include <tarq/core.h>
#include <tarq/systemd.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/tarqsystemd/bus_units.h"
#include "tests/support/temp_root.h"

namespace {

namespace fs = std::filesystem;
using tarq_systemd::BusUnits;
using tarq_systemd::Outcome;
using tarq_systemd::Status;
using tarq_systemd::UnitState;
using testing::_;
using testing::DoAll;
using testing::Return;
using testing::SetArgPointee;
using testing::StrEq;

// ---- Below a root folder: the supervisor ----

class Supervised : public testing::Test {
protected:
    ~Supervised() override { TARQSystemdStop("unit"); }

    void Configure(const std::string& command, const std::string& more = "") const {
        root_.Write("usr/tarq/etc/tarqsystemd.conf",
                    "[unit]\ncommand=\"" + command + "\"\n" + more);
    }
    /// A shell script that runs after it has written "ready" into the file of that name.
    void ConfigureScript(const std::string& script, const std::string& more = "") const {
        Configure("/bin/sh '" + root_.Write("a script.sh", script) + "'", more);
    }
    std::string WaitForText(const std::string& name) const {
        for (int i = 0; i < 1000 && test::ReadFile(root_.Path(name)).empty(); ++i) {
            usleep(10'000);
        }
        return test::ReadFile(root_.Path(name));
    }
    pid_t RecordedPid() const {
        return atoi(test::ReadFile(root_.Path("var/run/unit.pid")).c_str());
    }

    test::TempRoot root_;
};

TEST_F(Supervised, UnitIsStartedOnceAndStopped) {
    ConfigureScript(
        "trap 'echo ended > $TARQ_ROOT/end; exit 0' TERM\n"
        "ls /proc/self/fd | wc -l > $TARQ_ROOT/ready\nwhile :; do sleep 0.05; done\n");
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 0);
    const int leaked = dup(STDERR_FILENO);
    ASSERT_EQ(TARQSystemdStart("unit"), 1);
    close(leaked);
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 1);
    const pid_t pid = RecordedPid();
    EXPECT_EQ(KAPICProcAliveByPidFile(root_.Path("var/run/unit.pid").c_str()), 1);
    EXPECT_NE(getsid(pid), getsid(0));
    EXPECT_EQ(waitpid(pid, nullptr, WNOHANG), -1) << "the command is nobody's child here";
    EXPECT_EQ(WaitForText("ready"), "4\n") << "the standard streams, and the folder that ls reads";

    EXPECT_EQ(TARQSystemdStart("unit"), 1);
    EXPECT_EQ(RecordedPid(), pid);

    EXPECT_EQ(TARQSystemdStop("unit"), 1);
    EXPECT_EQ(test::ReadFile(root_.Path("end")), "ended\n");
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 0);
    EXPECT_EQ(TARQSystemdStop("unit"), 1);
}

TEST_F(Supervised, UnitThatIgnoresTheRequestIsKilledWithItsChildren) {
    ConfigureScript(
        "trap '' TERM\nsleep 1000 &\necho $! > $TARQ_ROOT/ready\nwait\nwhile :; do sleep 1; done\n",
        "stop_seconds=\"0\"\n");
    ASSERT_EQ(TARQSystemdStart("unit"), 1);
    const pid_t child = atoi(WaitForText("ready").c_str());
    ASSERT_GT(child, 0);
    const std::string child_stat = "/proc/" + std::to_string(child) + "/stat";
    EXPECT_EQ(TARQSystemdStop("unit"), 1);
    EXPECT_EQ(TARQSystemdActiveStatusGet("unit"), 0);
    const auto is_running = [&] {
        const std::string stat = test::ReadFile(child_stat);
        return !stat.empty() && stat.find(") Z ") == std::string::npos;
    };
    for (int i = 0; i < 1000 && is_running(); ++i) {
        usleep(10'000);
    }
    EXPECT_FALSE(is_running());
}

TEST_F(Supervised, ProcessThatOnlyHasTheNumberIsNotTheUnit) {
    const pid_t stranger = fork();
    if (stranger == 0) {
        pause();
        _exit(0);
    }
    for (const std::string start_time : {"\n12345\n", "\n", "", " x"}) {
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
    const std::pair<const char*, int> commands[] = {
        {"/nowhere/zel_daemon", TARQ_ERR_SERVICE},
        {"sleep 1000", TARQ_ERR_BAD_PARAMETER},
        {"/bin/sleep '1000", TARQ_ERR_BAD_PARAMETER},
        {"", TARQ_ERR_BAD_PARAMETER},
    };
    for (const auto& [command, code] : commands) {
        Configure(command);
        EXPECT_EQ(TARQSystemdStart("unit"), 0) << command;
        EXPECT_EQ(KAPICErrGet(), code) << command;
        EXPECT_FALSE(fs::exists(root_.Path("var/run/unit.pid"))) << command;
    }
    Configure("/etc/passwd");
    EXPECT_EQ(TARQSystemdStart("unit"), 0);
    EXPECT_EQ(errno, EACCES);
}

TEST_F(Supervised, StartersDoNotStartItTwice) {
    ConfigureScript("echo x >> $TARQ_ROOT/starts\nexec sleep 1000\n");
    constexpr int kStarters = 4;
    std::vector<std::thread> starters;
    starters.reserve(kStarters);
    for (int i = 0; i < kStarters; ++i) {
        starters.emplace_back([] { EXPECT_EQ(TARQSystemdStart("unit"), 1); });
    }
    for (std::thread& starter : starters) {
        starter.join();
    }
    WaitForText("starts");
    EXPECT_EQ(TARQSystemdStop("unit"), 1);
    EXPECT_EQ(test::ReadFile(root_.Path("starts")), "x\n");
}

TEST(Units, NamesThatCouldLeadElsewhereAreRefused) {
    const test::TempRoot root;
    const std::string too_long(201, 'u');
    for (const char* name :
         {"", "../unit", "a/b", ".unit", "a]b", "a b", "a\nb", too_long.c_str()}) {
        EXPECT_LT(TARQSystemdActiveStatusGet(name), 0) << name;
        EXPECT_EQ(TARQSystemdStart(name), 0) << name;
        EXPECT_EQ(TARQSystemdStop(name), 0) << name;
        EXPECT_EQ(KAPICErrGet(), TARQ_ERR_BAD_PARAMETER);
    }
    EXPECT_LT(TARQSystemdActiveStatusGet(nullptr), 0);
}

// ---- Where the system manager runs ----

class MockBus : public tarq_systemd::ManagerBus {
public:
    MOCK_METHOD(int, GetState, (const std::string&, UnitState*), (override));
    MOCK_METHOD(int, RunJob, (const char*, const std::string&, std::chrono::seconds, std::string*),
                (override));
};

class OnTheBus : public testing::Test {
protected:
    auto State(const char* active, const char* sub = "") {
        return DoAll(SetArgPointee<1>(UnitState{active, sub}), Return(0));
    }
    auto Result(const char* result) { return DoAll(SetArgPointee<3>(result), Return(0)); }

    testing::NiceMock<MockBus>* bus_ = new testing::NiceMock<MockBus>;
    BusUnits units_{std::unique_ptr<MockBus>(bus_)};
};

TEST_F(OnTheBus, UnitIsActiveWhileItServes) {
    for (const auto& [active, expected] :
         {std::pair("active", Status::kActive), std::pair("reloading", Status::kActive),
          std::pair("activating", Status::kInactive), std::pair("deactivating", Status::kInactive),
          std::pair("failed", Status::kInactive)}) {
        EXPECT_CALL(*bus_, GetState(StrEq("zel_daemon.service"), _)).WillOnce(State(active));
        EXPECT_EQ(units_.StatusOf("zel_daemon"), expected) << active;
    }
    EXPECT_CALL(*bus_, GetState(StrEq("ready.target"), _)).WillOnce(Return(-ECONNREFUSED));
    EXPECT_EQ(units_.StatusOf("ready.target"), Status::kUnknown);
    EXPECT_EQ(errno, ECONNREFUSED);
    EXPECT_EQ(KAPICErrGet(), TARQ_ERR_SERVICE);
    EXPECT_EQ(BusUnits(nullptr).StatusOf("zel_daemon"), Status::kUnknown);
}

TEST_F(OnTheBus, StartSaysWhenSomeoneElseIsStarting) {
    EXPECT_CALL(*bus_, RunJob).Times(0);
    EXPECT_CALL(*bus_, GetState).WillOnce(State("activating", "start"));
    EXPECT_EQ(units_.Start("zel_daemon"), Outcome::kBusy);
}

TEST_F(OnTheBus, JobsEndDecidesStartAndStop) {
    EXPECT_CALL(*bus_, GetState).WillRepeatedly(State("activating", "auto-restart"));
    EXPECT_CALL(*bus_, RunJob(StrEq("StartUnit"), StrEq("zel_daemon.service"), _, _))
        .WillOnce(Result("done"))
        .WillOnce(Result("failed"))
        .WillOnce(Return(-EACCES));
    EXPECT_EQ(units_.Start("zel_daemon"), Outcome::kDone);
    EXPECT_EQ(units_.Start("zel_daemon"), Outcome::kFailed);
    EXPECT_EQ(units_.Start("zel_daemon"), Outcome::kFailed);
    EXPECT_EQ(errno, EACCES);

    EXPECT_CALL(*bus_, RunJob(StrEq("StopUnit"), _, _, _))
        .WillOnce(Result("done"))
        .WillRepeatedly(Return(-EIO));
    EXPECT_EQ(units_.Stop("zel_daemon"), Outcome::kDone);
    EXPECT_EQ(units_.Stop("zel_daemon"), Outcome::kFailed);
    EXPECT_CALL(*bus_, GetState).WillOnce(State("inactive"));
    EXPECT_EQ(units_.Stop("zel_daemon"), Outcome::kDone) << "the manager knows no such unit";
}

/// A message bus of the test's own with a manager on it that knows the unit "zel_daemon.service".
/// It announces the end of a job before it answers the call that queues the job, which is as the
/// true one may do.
class FakeManager {
public:
    FakeManager() {
        const std::string address = "unix:path=" + folder_.Path("bus");
        daemon_ = fork();
        if (daemon_ == 0) {
            execlp("dbus-daemon", "dbus-daemon", "--session", "--nofork", "--nopidfile",
                   ("--address=" + address).c_str(), nullptr);
            _exit(127);
        }
        setenv("DBUS_SYSTEM_BUS_ADDRESS", address.c_str(), 1);
        for (int i = 0;
             i < 500 && !fs::exists(folder_.Path("bus")) && waitpid(daemon_, nullptr, WNOHANG) == 0;
             ++i) {
            usleep(10'000);
        }
        static const sd_bus_vtable manager[] = {
            SD_BUS_VTABLE_START(0),
            SD_BUS_METHOD("LoadUnit", "s", "o", LoadUnit, SD_BUS_VTABLE_UNPRIVILEGED),
            SD_BUS_METHOD("StartUnit", "ss", "o", StartUnit, SD_BUS_VTABLE_UNPRIVILEGED),
            SD_BUS_METHOD("Subscribe", "", "", Subscribe, SD_BUS_VTABLE_UNPRIVILEGED),
            SD_BUS_SIGNAL("JobRemoved", "uoss", 0),
            SD_BUS_VTABLE_END,
        };
        static const sd_bus_vtable unit[] = {
            SD_BUS_VTABLE_START(0),
            SD_BUS_PROPERTY("ActiveState", "s", GetActive, 0, 0),
            SD_BUS_PROPERTY("SubState", "s", GetSub, 0, 0),
            SD_BUS_VTABLE_END,
        };
        running_ =
            fs::exists(folder_.Path("bus")) && sd_bus_open_system(&bus_) >= 0 &&
            sd_bus_add_object_vtable(bus_, nullptr, "/org/freedesktop/systemd1",
                                     "org.freedesktop.systemd1.Manager", manager, this) >= 0 &&
            sd_bus_add_object_vtable(bus_, nullptr, "/unit", "org.freedesktop.systemd1.Unit", unit,
                                     this) >= 0 &&
            sd_bus_request_name(bus_, "org.freedesktop.systemd1", 0) >= 0;
        if (running_) {
            thread_ = std::thread([this] {
                while (!stop_) {
                    if (sd_bus_process(bus_, nullptr) == 0) {
                        sd_bus_wait(bus_, 10'000);
                    }
                }
            });
        }
    }
    ~FakeManager() {
        stop_ = true;
        if (thread_.joinable()) {
            thread_.join();
        }
        sd_bus_unref(bus_);
        unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
        kill(daemon_, SIGTERM);
        waitpid(daemon_, nullptr, 0);
    }
    FakeManager(const FakeManager&) = delete;
    FakeManager& operator=(const FakeManager&) = delete;
    bool IsRunning() const { return running_; }

private:
    static int LoadUnit(sd_bus_message* call, void*, sd_bus_error*) {
        return sd_bus_reply_method_return(call, "o", "/unit");
    }
    static int Subscribe(sd_bus_message* call, void* self, sd_bus_error*) {
        static_cast<FakeManager*>(self)->subscribed_ = true;
        return sd_bus_reply_method_return(call, "");
    }
    static int StartUnit(sd_bus_message* call, void* self, sd_bus_error* error) {
        const char* name = nullptr;
        const char* mode = nullptr;
        sd_bus_message_read(call, "ss", &name, &mode);
        if (name != std::string("zel_daemon.service") || mode != std::string("replace")) {
            return sd_bus_error_set(error, SD_BUS_ERROR_ACCESS_DENIED, "no");
        }
        sd_bus* bus = sd_bus_message_get_bus(call);
        for (const auto& [job, result] :
             {std::pair("/job/6", "failed"), std::pair("/job/7", "done")}) {
            if (static_cast<FakeManager*>(self)->subscribed_) {
                sd_bus_emit_signal(bus, "/org/freedesktop/systemd1",
                                   "org.freedesktop.systemd1.Manager", "JobRemoved", "uoss", 1U,
                                   job, name, result);
            }
        }
        return sd_bus_reply_method_return(call, "o", "/job/7");
    }
    static int GetActive(sd_bus*, const char*, const char*, const char*, sd_bus_message* reply,
                         void*, sd_bus_error*) {
        return sd_bus_message_append(reply, "s", "activating");
    }
    static int GetSub(sd_bus*, const char*, const char*, const char*, sd_bus_message* reply, void*,
                      sd_bus_error*) {
        return sd_bus_message_append(reply, "s", "auto-restart");
    }

    test::TempFolder folder_;
    pid_t daemon_ = -1;
    sd_bus* bus_ = nullptr;
    bool running_ = false;
    bool subscribed_ = false;
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

TEST(ManagerBus, RunsJobsOnARealBus) {
    const FakeManager manager;
    if (!manager.IsRunning()) {
        GTEST_SKIP() << "no dbus-daemon here";
    }
    const auto bus = tarq_systemd::ConnectManagerBus();
    ASSERT_TRUE(bus);
    UnitState state;
    EXPECT_EQ(bus->GetState("zel_daemon.service", &state), 0);
    EXPECT_EQ(state.active + "/" + state.sub, "activating/auto-restart");
    std::string result;
    EXPECT_EQ(bus->RunJob("StartUnit", "zel_daemon.service", std::chrono::seconds(20), &result), 0);
    EXPECT_EQ(result, "done");
    EXPECT_EQ(bus->RunJob("StartUnit", "other.service", std::chrono::seconds(20), &result),
              -EACCES);
}

TEST(ManagerBus, IsNotThereWithoutABus) {
    setenv("DBUS_SYSTEM_BUS_ADDRESS", "unix:path=/nowhere/bus", 1);
    EXPECT_FALSE(tarq_systemd::ConnectManagerBus());
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
}

}  // namespace

// What a task does when, on a clock that the test sets; store, server and watch are played.
#include "programs/zel_daemon/task_machine.h"

#include <cstring>

#include "tests/support/test_clock.h"
#include "tests/support/testing.h"

namespace {

using namespace test;
using namespace testing;
using programs::Reach;
using programs::Trouble;
using zel_daemon::Recovery;
using zel_daemon::RunPlan;
using zel_daemon::ShareState;
using zel_daemon::Step;
using zel_daemon::TaskMachine;

constexpr int64_t kDay = int64_t{24} * 3600;
const programs::RunFailure kRefused = {Trouble::kRefused, 212, "refused", Reach::kShare};
const programs::RunFailure kBroken = {Trouble::kFailed, 12, "broken off", Reach::kShare};
const programs::RunFailure kAway = {Trouble::kLocal, 0, "not mounted", Reach::kShare};
const programs::RunFailure kBusy = {Trouble::kBusy, 23, "busy", Reach::kPaths};
const programs::RunFailure kUnreadable = {Trouble::kFailed, 23, "unreadable", Reach::kPaths};
const programs::RunFailure kDown = {Trouble::kFailed, 10, "refused", Reach::kRun};

class TaskMachineTest : public testing::Test {
protected:
    TaskMachineTest() { SetZone("UTC"); }
    ~TaskMachineTest() override { SetZone("UTC"); }

    void Have(const ZEL::Schedule& schedule, const std::list<std::string>& shares = {"a"},
              std::optional<int64_t> checked_until = {}) {
        zel_daemon::TaskRecord record;
        record.task.GetInfo().SetSchedule(schedule);
        record.task.GetInfo().SetShareList(shares);
        record.checked_until = checked_until.value_or(clock_.Now());
        machine_.emplace(record, clock_, config_, [this] { return chance_; });
        stored_.clear();
    }
    void HaveRealtime(const std::list<std::string>& shares = {"a"}) {
        Have(Make("realtime", "", 0), shares);
        Pass(0);
        Sent();
    }
    void HaveManual(const std::list<std::string>& shares = {"a"}) {
        Have(Make("manual", "", 0), shares);
    }
    void Pause(bool paused) {
        zel_daemon::TaskRecord record = machine_->Record();
        record.paused = paused;
        record.checked_until = clock_.Now();
        machine_->PauseSet(record);
    }
    void Ask() {
        machine_->Asked();
        Pass(0);
    }
    /// Something changes, and is sent if it may be.
    void Change(const std::string& share, const std::string& path) {
        machine_->Changed(share, path);
        Pass(1);
    }

    /// Lets time pass, from step to step; each is done at once.
    void Pass(int64_t seconds) {
        const int64_t end = clock_.elapsed + seconds * 1000;
        for (int i = 0;; ++i) {
            ASSERT_LT(i, 20000) << "it goes round and round";
            const Step step = machine_->NextStep();
            if (step.kind != Step::Kind::kWait && (step.kind != Step::Kind::kRun || !no_room_)) {
                Do(step);
            } else if (step.wait && clock_.elapsed + *step.wait <= end) {
                clock_.elapsed += *step.wait;
            } else {
                break;
            }
        }
        clock_.elapsed = end;
    }
    void End() { machine_->Ended(Result(machine_->Running()->order), {}); }
    /// Of the runs since the last call, oldest first: when they began.
    std::vector<std::string> Times() {
        sent_.clear();
        return std::exchange(times_, {});
    }
    /// Why, and what they sent.
    std::vector<std::string> Sent() {
        times_.clear();
        return std::exchange(sent_, {});
    }
    ShareState State(const std::string& share = "a") const { return machine_->StateOf(share); }

    TestClock clock_{"2015-03-20 12:00:00"};
    zel_daemon::DaemonConfig config_;
    double chance_ = 0.5;
    std::optional<TaskMachine> machine_;
    bool no_room_ = false;    // no run can start
    bool hold_ = false;       // a run lasts until End()
    bool disk_full_ = false;  // nothing can be stored
    int rescans_ = 0;
    std::optional<programs::RunFailure> down_;         // no run comes further
    std::map<std::string, programs::RunFailure> bad_;  // "share", or "share/path"
    std::vector<ZEL::Event> stored_;

private:
    void Do(const Step& step) {
        if (step.kind == Step::Kind::kRescan) {
            ++rescans_;
            machine_->Rescanned();
        } else if (disk_full_) {
            if (step.kind == Step::Kind::kRun) {
                EXPECT_TRUE(Begin(step));
            }
            machine_->StoreFailed("the disk is full");
        } else if (step.kind == Step::Kind::kStoreRecord) {
            machine_->RecordStored();
        } else if (step.kind == Step::Kind::kStoreChanges) {
            Store();
        } else if (step.kind == Step::Kind::kStoreEnd) {
            const std::vector<uint64_t>& sent = machine_->End()->sent;
            const auto gone = [&](const ZEL::Event& event) {
                return std::find(sent.begin(), sent.end(), event.GetID()) != sent.end();
            };
            stored_.erase(std::remove_if(stored_.begin(), stored_.end(), gone), stored_.end());
            machine_->EndStored();
        } else {
            if (machine_->HasDebounced()) {
                Store();
            }
            Start(Begin(step));
        }
    }
    void Store() {
        for (const auto& [share, paths] : machine_->DebouncedChanges()) {
            for (const std::string& path : paths) {
                ZEL::Event& event = stored_.emplace_back();
                event.SetID(++last_id_);
                event.SetShareName(share);
                event.SetRelativePath(path);
            }
        }
        machine_->ChangesStored();
    }
    std::optional<RunPlan> Begin(const Step& step) {
        return machine_->Begin(step, [&](const std::string& share, uint64_t after) {
            std::vector<ZEL::Event> events;
            for (const ZEL::Event& event : stored_) {
                if (event.GetShareName() == share && event.GetID() > after) {
                    events.push_back(event);
                }
            }
            return events;
        });
    }
    void Start(std::optional<RunPlan> plan) {
        if (!plan) {
            return;
        }
        static const char* const reasons[] = {"schedule", "change", "request", "retry"};
        times_.push_back(UtcText(plan->record.start));
        std::string& sent = sent_.emplace_back(reasons[static_cast<int>(plan->record.reason)]);
        for (const programs::ShareOrder& share : plan->order.shares) {
            for (const std::string& path : share.paths) {
                sent += " " + share.share + path;
            }
        }
        plan->record.id = ++last_id_;
        machine_->Started(std::move(*plan));
        if (!hold_) {
            End();
        }
    }
    programs::RunResult Result(const programs::RunOrder& order) const {
        if (down_) {
            return NothingDone(order, *down_);
        }
        programs::RunResult result;
        for (const programs::ShareOrder& share : order.shares) {
            for (const std::string& path : share.paths) {
                for (const std::string& what : {share.share, share.share + path}) {
                    if (bad_.count(what) != 0) {
                        result.undone.push_back({share.share, {path}, bad_.at(what)});
                        result.verdict = bad_.at(what);
                    }
                }
            }
        }
        return result;
    }

    std::vector<std::string> times_;
    std::vector<std::string> sent_;
    uint64_t last_id_ = 0;
};

// ---- The schedule ----

TEST_F(TaskMachineTest, RunsThatWereMissedAreMadeUpForOnceAndNightsThatChangeClocksHaveTheirs) {
    struct {
        const char* start;
        const char* checked_until;
        ZEL::Schedule schedule;
        std::vector<std::string> runs;  // in 38 hours
    } const cases[] = {
        {"2015-03-20 12:00:00",
         "2015-03-10 08:00:00",
         Make("weekly", "", 8),
         {"2015-03-20 12:00:00", "2015-03-21 07:00:00"}},
        {"2015-03-20 12:00:00",
         "2015-03-20 08:00:00",
         Make("weekly", "", 8),
         {"2015-03-21 07:00:00"}},
        {"2015-03-20 11:00:00",
         "2015-03-20 10:00:00",
         Make("weekly", "", 11, 1800, 3),
         {"2015-03-20 11:00:00", "2015-03-20 11:30:00", "2015-03-21 10:00:00",
          "2015-03-21 10:30:00", "2015-03-21 11:00:00", "2015-03-21 11:30:00"}},
        {"2015-03-20 12:00:00",
         "2015-03-10 00:00:00",
         Make("once", "2015-03-15", 8),
         {"2015-03-20 12:00:00"}},
        {"2015-03-20 12:00:00", "2015-03-20 12:00:00", Make("once", "2015-03-15", 8), {}},
        {"2015-03-20 12:00:00", "2015-03-10 00:00:00", Make("manual", "", 8), {}},
        {"2015-03-20 12:00:00",
         "1969-12-31 23:59:59",
         Make("weekly", "", 8),
         {"2015-03-20 12:00:00", "2015-03-21 07:00:00"}},
        // An hour that comes twice has its run twice; of a day's repeats one falls away or comes
        // once more, since the schedule counts them from the start as the time now in force has it.
        {"2025-03-29 12:00:00",
         "2025-03-29 12:00:00",
         Make("weekly", "", 2),
         {"2025-03-30 01:00:00", "2025-03-31 00:00:00"}},
        {"2025-03-29 12:00:00",
         "2025-03-29 12:00:00",
         Make("weekly", "", 1, 3600, 2),
         {"2025-03-30 00:00:00", "2025-03-30 01:00:00", "2025-03-30 23:00:00",
          "2025-03-31 00:00:00", "2025-03-31 01:00:00"}},
        {"2025-10-25 12:00:00",
         "2025-10-25 12:00:00",
         Make("weekly", "", 2),
         {"2025-10-26 00:00:00", "2025-10-26 01:00:00", "2025-10-27 01:00:00"}},
        {"2025-10-25 12:00:00",
         "2025-10-25 12:00:00",
         Make("weekly", "", 1, 3600, 2),
         {"2025-10-25 23:00:00", "2025-10-26 00:00:00", "2025-10-26 01:00:00",
          "2025-10-26 02:00:00", "2025-10-27 00:00:00", "2025-10-27 01:00:00"}},
    };
    SetZone("Europe/Berlin");
    for (const auto& c : cases) {
        clock_.Set(c.start);
        Have(c.schedule, {"a"}, Utc(c.checked_until));
        EXPECT_EQ(machine_->NextRun().has_value(), !c.runs.empty());
        Pass(38 * 3600 - 1);
        EXPECT_EQ(Times(), c.runs);
        // What is stored is enough to go on from.
        const auto next = machine_->NextRun();
        Have(c.schedule, {"a"}, machine_->Record().checked_until);
        EXPECT_EQ(machine_->NextRun(), next);
    }
}

TEST_F(TaskMachineTest, ClocksAndZonesThatJumpMakeUpForOneRunAndLoseNone) {
    clock_.Set("2015-03-20 07:59:00");
    Have(Make("weekly", "", 8, 3600, 1));
    const auto set = [&](const char* to, int64_t pass) {
        clock_.Set(to);
        Pass(pass);
        return Times();
    };
    Pass(120);
    EXPECT_THAT(Times(), ElementsAre("2015-03-20 08:00:00"));
    EXPECT_THAT(set("2020-01-01 00:00:00", 9 * 3600 - 1),
                ElementsAre("2020-01-01 00:00:00", "2020-01-01 08:00:00"));
    EXPECT_THAT(set("2015-03-20 08:30:00", kDay),
                ElementsAre("2015-03-20 09:00:00", "2015-03-21 08:00:00"));
    EXPECT_THAT(set("1970-01-01 00:00:00", 10), IsEmpty());  // an empty clock battery
    EXPECT_THAT(set("2015-03-21 08:30:00", 60), ElementsAre("2015-03-21 08:30:00"));
    // Set right by a few seconds, just after a run: it is not made twice, the next one is made.
    EXPECT_THAT(set("2015-03-21 08:59:59", 2), ElementsAre("2015-03-21 09:00:00"));
    clock_.Set("2015-03-21 08:59:41");
    Ask();
    EXPECT_THAT(Times(), ElementsAre("2015-03-21 08:59:41"));
    Pass(kDay);
    EXPECT_THAT(Times(), ElementsAre("2015-03-22 08:00:00"));

    SetZone("Asia/Tokyo");
    machine_->ZoneChanged();
    Pass(kDay);
    EXPECT_THAT(Times(), ElementsAre("2015-03-22 23:00:00", "2015-03-23 00:00:00"));
    Pause(true);
    EXPECT_FALSE(machine_->NextRun());
    Pass(2 * kDay);
    Ask();
    EXPECT_THAT(Sent(), ElementsAre("request a/"));
    Pause(false);  // what fell due meanwhile was not wanted
    Pass(3600);
    EXPECT_THAT(Sent(), IsEmpty());
}

// ---- What fails ----

TEST_F(TaskMachineTest, RetriesOfARunComeLaterAndLaterAndNotAllAtTheSameMoment) {
    HaveManual();
    down_ = kDown;
    const std::pair<double, int64_t> tries[] = {
        {0.5, 10000},   {0.5, 20000},  {0, 32000},     {1, 96000},   {0.25, 144000},
        {0.5, 320000},  {0.5, 640000}, {0.5, 1280000}, {0, 2048000}, {0.5, 3600000},
        {0.5, 3600000}, {1, 4320000},  {0, 2880000},
    };
    machine_->Asked();
    for (const auto& [chance, delay] : tries) {
        chance_ = chance;
        Pass(0);
        EXPECT_EQ(machine_->UntilRetry(), delay);
        EXPECT_EQ(Sent().size(), 1u);
        clock_.offset -= 1000;  // the clock that people see does not matter
        Pass(delay / 1000 - 1);
        EXPECT_THAT(Sent(), IsEmpty());
        clock_.elapsed += 1000;
    }
    EXPECT_EQ(machine_->Last()->result, ZEL::TASK_RESULT_FAILED);
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("waits for its server"));
    down_.reset();
    Pass(0);
    EXPECT_THAT(Sent(), ElementsAre(HasSubstr("retry a/")));
    EXPECT_FALSE(machine_->UntilRetry());
    // What always fails: the schedule's runs, and tries until their wait is longer than its period.
    chance_ = 0.5;
    down_ = kDown;
    clock_.Set("2015-03-20 00:00:00");
    Have(Make("weekly", "", 0, 900, 95), {"a"}, clock_.Now() - kDay);
    Pass(kDay - 1);
    EXPECT_THAT(Sent().size(), AllOf(Ge(96u), Le(96u + 10)));
}

TEST_F(TaskMachineTest, OnlyTheShareOrThePathThatFailedWaits) {
    HaveRealtime({"a", "b", "c"});
    // A share that fails as a whole: all of it waits, and nothing else.
    bad_ = {{"b", kRefused}};
    Change("b", "/deep/x");
    Change("a", "/x");
    Change("b", "/low/x");
    EXPECT_THAT(Sent(), ElementsAre("change b/deep/x", "change a/x"));
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("share 'b' waits for the server"));
    EXPECT_EQ(stored_.size(), 2u);
    bad_.clear();
    Pass(15);
    EXPECT_THAT(Sent(), ElementsAre("retry b/deep/x b/low/x"));
    EXPECT_THAT(stored_, IsEmpty());
    EXPECT_EQ(machine_->WaitsFor(), "");
    EXPECT_FALSE(machine_->UntilRetry());

    // A path that fails: what else changes in the share goes at once.
    bad_ = {{"a/deep/x", kUnreadable}};
    Change("a", "/deep/x");
    Change("a", "/low/x");
    Change("a", "/deep/x");  // which may have been mended: once a minute at most
    EXPECT_THAT(Sent(), ElementsAre("change a/deep/x", "change a/low/x", "change a/deep/x"));
    bad_.clear();
    Pass(35);
    EXPECT_THAT(Sent(), ElementsAre("retry a/deep/x"));
    EXPECT_THAT(stored_, IsEmpty());

    // A share that is always busy is tried at least about once a minute.
    bad_ = {{"c", kBusy}};
    Change("c", "/x");
    Pass(600);
    EXPECT_THAT(Sent().size(), AllOf(Ge(9u), Le(15u)));
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("until fewer files change"));

    // A task with a schedule tries the shares that failed again, not the others.
    HaveManual({"a", "b", "c"});
    bad_ = {{"b", kRefused}, {"c", kAway}};
    Ask();
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("share 'b' and 1 other share wait for the server"));
    bad_.clear();
    Pass(kDay);
    EXPECT_THAT(Sent(), ElementsAre("request a/ b/ c/", "retry b/ c/"));
}

TEST_F(TaskMachineTest, WhatHasComeBackIsTriedAtOnceButNotAllTheTime) {
    bool is_there = false;
    const auto recover = [&](Recovery what) {
        machine_->Recovered({what}, [&](const std::string&) { return is_there; });
        Pass(0);
        return Sent().size();
    };
    HaveManual();
    bad_ = {{"a", kAway}};
    Ask();
    Pass(700);
    EXPECT_THAT(Sent().size(), Ge(5u));
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("share 'a' waits for the volume"));
    EXPECT_EQ(recover(Recovery::kVolume), 0u) << "another share's";
    is_there = true;
    EXPECT_EQ(recover(Recovery::kNetwork), 0u);
    EXPECT_EQ(recover(Recovery::kVolume), 1u);

    // A network that comes and goes: between two tries lies the first wait.
    for (const programs::RunFailure& verdict : {kDown, kBroken}) {
        HaveManual();
        bad_.clear();
        down_.reset();
        verdict.reach == Reach::kRun ? (void)(down_ = verdict) : (void)(bad_ = {{"a", verdict}});
        Ask();
        Pass(700);
        Sent();
        EXPECT_EQ(recover(Recovery::kVolume), 0u);
        size_t tries = 0;
        for (int i = 0; i < 120; ++i) {
            tries += recover(i % 2 ? Recovery::kNetwork : Recovery::kSettings);
            Pass(1);
            tries += Sent().size();
        }
        EXPECT_THAT(tries, AllOf(Ge(11u), Le(13u)));
    }
}

TEST_F(TaskMachineTest, WhatAPersonCancelsIsOver) {
    Have(Make("weekly", "", 8));
    EXPECT_FALSE(machine_->Cancelled());
    hold_ = true;
    Ask();
    machine_->Asked();  // asks for no second one
    EXPECT_TRUE(machine_->Cancelled());
    down_ = {Trouble::kCancelled, 20, "cancelled", Reach::kRun};
    End();
    hold_ = false;
    EXPECT_EQ(machine_->Last()->result, ZEL::TASK_RESULT_CANCELLED);
    Pass(3600);
    EXPECT_EQ(Sent().size(), 1u);
    for (const programs::RunFailure& verdict : {kDown, kRefused}) {  // one that waits for its retry
        down_ = verdict;
        Ask();
        EXPECT_GT(machine_->UntilRetry().value_or(0), 0);
        EXPECT_TRUE(machine_->Cancelled());
        EXPECT_FALSE(machine_->UntilRetry());
        Pass(3600);
        EXPECT_EQ(Sent().size(), 1u);
    }
    down_.reset();
    no_room_ = true;  // one that waits for its turn
    Pass(kDay);
    EXPECT_NE(machine_->DueSince(), 0);
    EXPECT_TRUE(machine_->Cancelled());
    no_room_ = false;
    Pass(3600);
    EXPECT_THAT(Sent(), IsEmpty());

    // A realtime task's changes wait for the next one, or for a person.
    HaveRealtime();
    down_ = kDown;
    Change("a", "/x");
    EXPECT_TRUE(machine_->Cancelled());
    down_.reset();
    Pass(kDay);
    EXPECT_THAT(Sent(), ElementsAre("change a/x"));
    Change("a", "/y");
    EXPECT_THAT(Sent(), ElementsAre("change a/x a/y"));
}

// ---- The two states of a share ----

TEST_F(TaskMachineTest, ChangesAreSentOnceItIsQuietAndAFloodAllTheSame) {
    Have(Make("realtime", "", 0), {"a", "b"});
    EXPECT_EQ(State(), ShareState::kUnknown);
    no_room_ = true;  // as while the folders are found
    Pass(5);
    no_room_ = false;
    Pass(0);
    EXPECT_THAT(Sent(), ElementsAre("change a/ b/"));
    EXPECT_EQ(State(), ShareState::kTracked);
    for (int i = 0; i < 5; ++i) {
        machine_->Changed("a", "/" + std::to_string(i % 2));
        clock_.elapsed += 900;
        Pass(0);
        EXPECT_THAT(Sent(), IsEmpty());
    }
    Pass(1);
    EXPECT_THAT(Sent(), ElementsAre("change a/0 a/1"));
    for (int i = 0; i < 29; ++i) {
        machine_->Changed("b", "/x");
        clock_.elapsed += 500;
        Pass(0);
    }
    EXPECT_THAT(Sent(), ElementsAre("change b/x"));
    // While it waits for its turn, changes are stored all the same.
    Pass(2);
    Sent();
    no_room_ = true;
    Change("a", "/x");
    Change("b", "/x");
    EXPECT_EQ(stored_.size(), 2u);
}

TEST_F(TaskMachineTest, ALossOfTheWatchOrAFailedResyncLeadsToAResync) {
    HaveRealtime({"a", "b"});
    machine_->Lost("a", false);
    EXPECT_EQ(State("a"), ShareState::kUnknown);
    EXPECT_EQ(State("b"), ShareState::kTracked);
    Change("b", "/x");
    EXPECT_THAT(Sent(), ElementsAre("change a/ b/x"));
    machine_->Watched("b");  // at another place, say
    hold_ = true;
    Pass(0);
    machine_->Lost("b", false);  // while it is resynced
    End();
    hold_ = false;
    EXPECT_EQ(State("b"), ShareState::kUnknown);
    bad_ = {{"b", kRefused}};
    Change("b", "/y");
    EXPECT_EQ(State("b"), ShareState::kUnknown);
    EXPECT_EQ(stored_.size(), 1u);
    bad_.clear();
    Pass(15);
    EXPECT_THAT(Sent(), ElementsAre("change b/", "change b/", "retry b/"));
    EXPECT_EQ(State("b"), ShareState::kTracked);
    EXPECT_THAT(stored_, IsEmpty());
    // What a receiver that died has left is compared away.
    bad_ = {{"b", kBroken}};
    Change("b", "/z");
    bad_.clear();
    Pass(15);
    EXPECT_THAT(Sent(), ElementsAre("change b/z", "retry b/"));
    // A run that fails as a whole leaves everything as it was.
    down_ = kDown;
    Change("a", "/x");
    machine_->Lost("b", false);
    Pass(15);
    EXPECT_EQ(State("a"), ShareState::kTracked);
    EXPECT_EQ(State("b"), ShareState::kUnknown);
    down_.reset();
    Pass(30);
    EXPECT_THAT(Sent(), ElementsAre("change a/x", "retry a/x b/", "retry a/x b/"));
}

TEST_F(TaskMachineTest, WhatIsNotWatchedIsResyncedNowAndThen) {
    HaveRealtime({"a", "b"});
    machine_->Lost("a", true);
    Pass(1);
    EXPECT_THAT(Sent(), ElementsAre("change a/"));
    Pass(1798);
    EXPECT_THAT(Sent(), ElementsAre("change a/"));
    EXPECT_EQ(rescans_, 1);
    machine_->Covered("a");
    Pass(kDay);
    EXPECT_THAT(Sent(), IsEmpty());
    machine_->Lost("a", true);
    Pass(0);
    hold_ = true;
    Ask();
    machine_->Cancelled();
    End();
    hold_ = false;
    Sent();
    Pass(kDay);
    EXPECT_THAT(Sent(), IsEmpty()) << "before something changes, or a person asks";
    Ask();
    Pass(1000);
    EXPECT_THAT(Sent(), ElementsAre("request a/ b/", "change a/"));
    Pause(true);
    Pass(kDay);
    EXPECT_THAT(Sent(), IsEmpty());
    Pause(false);
    Pass(kDay);
    EXPECT_THAT(Sent(), ElementsAre("change a/ b/"));
}

TEST_F(TaskMachineTest, AfterARestartAllIsResyncedAndWhatWasCutOffMadeUpFor) {
    HaveRealtime();
    down_ = kDown;
    Change("a", "/x");
    const std::vector<ZEL::Event> stored = stored_;
    EXPECT_EQ(stored.size(), 1u);
    zel_daemon::RunRecord cut_off = *machine_->Last();
    Sent();
    for (const auto result : {ZEL::TASK_RESULT_SUCCESS, ZEL::TASK_RESULT_FAILED}) {
        down_.reset();
        Have(Make("realtime", "", 0));
        stored_ = stored;
        cut_off.result = result;
        machine_->Restored(true, cut_off);
        Pass(0);
        EXPECT_EQ(Sent().size(), result == ZEL::TASK_RESULT_SUCCESS ? 1u : 0u);
        Pass(15);
        EXPECT_EQ(Sent().size(), result == ZEL::TASK_RESULT_SUCCESS ? 0u : 1u);
        EXPECT_THAT(stored_, IsEmpty());
    }
    HaveManual();
    machine_->Restored(false, cut_off);
    Pass(15);
    EXPECT_THAT(Sent(), ElementsAre(HasSubstr("retry a/")));
    machine_->Edited(machine_->Record());
    Pass(kDay);
    EXPECT_THAT(Sent(), IsEmpty());
}

// ---- The store ----

TEST_F(TaskMachineTest, AStoreThatCannotBeWrittenForAWhileLosesNothing) {
    HaveRealtime();
    disk_full_ = true;
    Change("a", "/one");
    EXPECT_EQ(machine_->StoreProblem(), "the disk is full");
    Pass(20);
    EXPECT_THAT(Sent(), IsEmpty());
    disk_full_ = false;
    Pass(10);
    EXPECT_THAT(Sent(), ElementsAre("change a/one"));
    EXPECT_EQ(machine_->StoreProblem(), "");

    for (const bool fails : {false, true}) {  // when a run ends
        hold_ = true;
        Change("a", "/two");
        down_ = fails ? std::optional(kDown) : std::nullopt;
        End();
        hold_ = false;
        down_.reset();
        disk_full_ = true;
        Change("a", "/three");
        Pass(60);
        EXPECT_THAT(Sent(), ElementsAre("change a/two")) << "nothing before that end is stored";
        disk_full_ = false;
        Pass(10);
        EXPECT_THAT(Sent(), ElementsAre(fails ? "retry a/three a/two" : "change a/three"));
        EXPECT_THAT(stored_, IsEmpty());
    }

    Have(Make("weekly", "", 8), {"a", "b"});  // when a run begins
    clock_.Set("2015-03-21 07:59:59");
    disk_full_ = true;
    Pass(60);
    EXPECT_THAT(Sent(), IsEmpty());
    EXPECT_FALSE(machine_->Running());
    disk_full_ = false;
    Pass(10);
    EXPECT_THAT(Sent(), ElementsAre("schedule a/ b/"));
    EXPECT_EQ(machine_->Record().checked_until, Utc("2015-03-21 08:01:00"));
}

TEST(SystemClock, GoesOnAndTwoTasksDoNotRetryAtTheSameMoment) {
    const zel_daemon::SystemClock clock;
    EXPECT_NEAR(static_cast<double>(clock.Now()), static_cast<double>(time(nullptr)), 1);
    const int64_t start = clock.Elapsed();
    usleep(20000);
    EXPECT_NEAR(static_cast<double>(clock.Elapsed() - start), 20, 15);
    zel_daemon::TaskPlan one(clock, ZEL::Schedule(), 0), other(clock, ZEL::Schedule(), 0);
    for (int i = 0; i < 10; ++i) {
        one.Failed({}), other.Failed({});
    }
    EXPECT_NE(*one.RetryAt() / 50, *other.RetryAt() / 50);
}

}  // namespace

// What a task does when, on a clock that the test sets; store, server and watch are played.
#include "programs/zel_daemon/task_machine.h"

#include "tests/support/test_clock.h"
#include "tests/support/testing.h"

namespace {

using namespace test;
using namespace testing;
using programs::FailureKind;
using programs::Reach;
using zel_daemon::Recovery;
using zel_daemon::RunPlan;
using zel_daemon::ShareState;
using zel_daemon::Step;
using zel_daemon::TaskMachine;

constexpr int64_t kDay = int64_t{24} * 3600;
const programs::RunFailure kRefused = {FailureKind::kRefused, 212, "refused", Reach::kShare};
const programs::RunFailure kBroken = {FailureKind::kFailed, 12, "broken off", Reach::kShare};
const programs::RunFailure kAway = {FailureKind::kLocal, 0, "not mounted", Reach::kShare};
const programs::RunFailure kBusy = {FailureKind::kBusy, 23, "busy", Reach::kPaths};
const programs::RunFailure kUnreadable = {FailureKind::kFailed, 23, "unreadable", Reach::kPaths};
const programs::RunFailure kDown = {FailureKind::kFailed, 10, "refused", Reach::kRun};
const programs::RunFailure kTalkative = {FailureKind::kRefused, 212, std::string(70000, 'x'),
                                         Reach::kRun, std::string(70000, 'y')};

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
    }
    void Pause(bool paused) {
        zel_daemon::TaskRecord record = machine_->Record();
        record.paused = paused;
        record.checked_until = clock_.Now();
        machine_->PauseSet(record);
    }
    // These return what was sent meanwhile and since the last call, and why: one entry a run, as
    // "schedule a/, change a/x b/y".
    std::string Ask() {
        machine_->Asked();
        return Pass(0);
    }
    std::string Change(const std::string& share, const std::string& path) {
        machine_->Changed(share, path);
        return Pass(1);
    }
    /// The run that is held ends.
    std::string End() {
        hold_ = false;
        machine_->Ended(Result(machine_->Running()->order), {});
        return Pass(0);
    }
    /// Lets time pass, from step to step; each is done at once.
    std::string Pass(int64_t seconds) {
        const int64_t end = clock_.elapsed + seconds * 1000;
        for (int i = 0; i < 20000; ++i) {
            Search();
            const Step step = machine_->NextStep();
            if (step.kind != Step::Kind::kWait && (step.kind != Step::Kind::kRun || !no_room_)) {
                Do(step);
            } else if (step.wait && clock_.elapsed + *step.wait <= end) {
                clock_.elapsed += *step.wait;
            } else {
                clock_.elapsed = end;
                return std::exchange(sent_, "");
            }
        }
        throw std::runtime_error("it goes round and round");
    }
    /// What is to be searched, is, unless a run is under way.
    void Search() {
        const std::map<std::string, uint64_t> shares = machine_->ToSearch();
        for (const auto& [share, number] : machine_->Running() ? decltype(shares)() : shares) {
            machine_->Searched(share, number, indexed_);
        }
    }
    /// How many runs Pass() has told.
    static size_t Count(const std::string& sent) {
        return sent.empty() ? 0
                            : static_cast<size_t>(std::count(sent.begin(), sent.end(), ',')) + 1;
    }
    /// When the runs since the last call began, as "20 12:00, 21 08:00".
    std::string Times() { return std::exchange(times_, ""); }
    ShareState State(const std::string& share = "a") const { return machine_->StateOf(share); }

    TestClock clock_{"2015-03-20 12:00:00"};
    zel_daemon::DaemonConfig config_;
    double chance_ = 0.5;
    std::optional<TaskMachine> machine_;
    bool no_room_ = false;    // no run can start
    bool hold_ = false;       // a run lasts until End()
    bool disk_full_ = false;  // nothing can be stored
    int rescans_ = 0;
    std::optional<int64_t> indexed_;            // a search finds all there is, see Searched()
    std::optional<programs::RunFailure> down_;  // no run comes further
    std::map<std::string, programs::RunFailure> bad_;                 // "share", or "share/path"
    std::map<std::pair<std::string, std::string>, uint64_t> stored_;  // changes, and their numbers

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
            for (const uint64_t id : machine_->End()->sent) {
                stored_.erase(std::find_if(stored_.begin(), stored_.end(),
                                           [&](const auto& entry) { return entry.second == id; }));
            }
            if (!machine_->End()->moved.empty()) {
                moves_.clear();
            }
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
                stored_.emplace(std::pair(share, path), ++last_id_);
            }
            for (const programs::ShareMove& move : machine_->DebouncedMoves(share)) {
                moves_.push_back({++last_id_, {move.from, move.to}});
            }
        }
        machine_->ChangesStored();
    }
    std::optional<RunPlan> Begin(const Step& step) {
        return machine_->Begin(
            step,
            [&](const std::string& share, uint64_t after) {
                std::vector<ZEL::Event> events;
                for (const auto& [what, id] : stored_) {
                    if (what.first == share && id > after) {
                        ZEL::Event& event = events.emplace_back();
                        event.SetID(id);
                        event.SetShareName(share);
                        event.SetRelativePath(what.second);
                    }
                }
                return events;
            },
            [this](const std::string&) { return moves_; });
    }
    void Start(std::optional<RunPlan> plan) {
        if (!plan) {
            return;
        }
        static const std::string reasons[] = {"schedule", "change", "request", "retry"};
        times_ += (times_.empty() ? "" : ", ") + UtcText(plan->record.start).substr(8, 8);
        sent_ += (sent_.empty() ? "" : ", ") + reasons[static_cast<int>(plan->record.reason)];
        for (const programs::ShareOrder& share : plan->order.shares) {
            for (const std::string& path : share.paths) {
                sent_ += " " + share.share + path;
            }
            for (const programs::ShareMove& move : share.moves) {
                sent_ += " " + move.from + ">" + move.to + (move.is_settled ? "" : "?") +
                         (move.is_untouched ? "!" : "");
            }
        }
        plan->record.id = ++last_id_;
        machine_->Started(std::move(*plan));
        if (!hold_) {
            machine_->Ended(Result(machine_->Running()->order), {});
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
                        result.failure = bad_.at(what);
                    }
                }
            }
        }
        return result;
    }

    std::string times_;
    std::string sent_;
    uint64_t last_id_ = 0;
    std::vector<zel_daemon::StoredMove> moves_;  // of share "a"
};

// ---- The schedule ----

TEST_F(TaskMachineTest, RunsThatWereMissedAreMadeUpForOnceAndNightsThatChangeClocksHaveTheirs) {
    struct {
        const char* start;
        const char* checked_until;
        ZEL::Schedule schedule;
        std::string runs;  // in 38 hours
    } const cases[] = {
        {"2015-03-20 12:00:00", "2015-03-10 08:00:00", Make("weekly", "", 8), "20 12:00, 21 07:00"},
        {"2015-03-20 12:00:00", "2015-03-20 08:00:00", Make("weekly", "", 8), "21 07:00"},
        {"2015-03-20 11:00:00", "2015-03-20 10:00:00", Make("weekly", "", 11, 1800, 3),
         "20 11:00, 20 11:30, 21 10:00, 21 10:30, 21 11:00, 21 11:30"},
        {"2015-03-20 12:00:00", "2015-03-10 00:00:00", Make("once", "2015-03-15", 8), "20 12:00"},
        {"2015-03-20 12:00:00", "2015-03-20 12:00:00", Make("once", "2015-03-15", 8), ""},
        {"2015-03-20 12:00:00", "2015-03-10 00:00:00", Make("manual", "", 8), ""},
        {"2015-03-20 12:00:00", "1969-12-31 23:59:59", Make("weekly", "", 8), "20 12:00, 21 07:00"},
        // An hour that comes twice has its run twice; of a day's repeats one falls away or comes
        // once more, since the schedule counts them from the start as the time now in force has it.
        {"2025-03-29 12:00:00", "2025-03-29 12:00:00", Make("weekly", "", 2), "30 01:00, 31 00:00"},
        {"2025-03-29 12:00:00", "2025-03-29 12:00:00", Make("weekly", "", 1, 3600, 2),
         "30 00:00, 30 01:00, 30 23:00, 31 00:00, 31 01:00"},
        {"2025-10-25 12:00:00", "2025-10-25 12:00:00", Make("weekly", "", 2),
         "26 00:00, 26 01:00, 27 01:00"},
        {"2025-10-25 12:00:00", "2025-10-25 12:00:00", Make("weekly", "", 1, 3600, 2),
         "25 23:00, 26 00:00, 26 01:00, 26 02:00, 27 00:00, 27 01:00"},
    };
    SetZone("Europe/Berlin");
    for (const auto& c : cases) {
        clock_.Set(c.start);
        Have(c.schedule, {"a"}, Utc(c.checked_until));
        EXPECT_EQ(machine_->NextRun().has_value(), c.runs != "");
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
    EXPECT_EQ(Times(), "20 08:00");
    EXPECT_EQ(set("2020-01-01 00:00:00", 9 * 3600 - 1), "01 00:00, 01 08:00");
    EXPECT_EQ(set("2015-03-20 08:30:00", kDay), "20 09:00, 21 08:00");
    EXPECT_EQ(set("1970-01-01 00:00:00", 10), "");  // an empty clock battery
    EXPECT_EQ(set("2015-03-21 08:30:00", 60), "21 08:30");
    // Set right by a few seconds, just after a run: it is not made twice, the next one is made.
    EXPECT_EQ(set("2015-03-21 08:59:59", 2), "21 09:00");
    clock_.Set("2015-03-21 08:59:41");
    Ask();
    EXPECT_EQ(Times(), "21 08:59");
    Pass(kDay);
    EXPECT_EQ(Times(), "22 08:00");

    SetZone("Asia/Tokyo");
    machine_->ZoneChanged();
    Pass(kDay);
    EXPECT_EQ(Times(), "22 23:00, 23 00:00");
    Pause(true);
    EXPECT_FALSE(machine_->NextRun());
    EXPECT_EQ(Pass(2 * kDay), "");
    EXPECT_EQ(Ask(), "request a/");
    Pause(false);  // what fell due meanwhile was not wanted
    EXPECT_EQ(Pass(3600), "");
}

// ---- What fails ----

TEST_F(TaskMachineTest, RetriesOfARunComeLaterAndLaterAndNotAllAtTheSameMoment) {
    Have(Make("manual", "", 0));
    down_ = kDown;
    const std::pair<double, int64_t> tries[] = {
        {0.5, 10000},  {0.5, 20000},   {0, 32000},   {1, 96000},     {0.25, 144000}, {0.5, 320000},
        {0.5, 640000}, {0.5, 1280000}, {0, 2048000}, {0.5, 3600000}, {1, 4320000},   {0, 2880000}};
    machine_->Asked();
    for (const auto& [chance, delay] : tries) {
        chance_ = chance;
        EXPECT_EQ(Count(Pass(0)), 1u);
        EXPECT_EQ(machine_->UntilRetry(), delay);
        clock_.offset -= 1000;  // the clock that people see does not matter
        EXPECT_EQ(Pass(delay / 1000 - 1), "");
        clock_.elapsed += 1000;
    }
    EXPECT_EQ(machine_->Last()->result, ZEL::TASK_RESULT_FAILED);
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("waits for its server"));
    down_.reset();
    EXPECT_EQ(Pass(0), "retry a/");
    EXPECT_FALSE(machine_->UntilRetry());
    // What always fails: the schedule's runs, and tries until their wait is longer than its period.
    chance_ = 0.5;
    down_ = kDown;
    clock_.Set("2015-03-20 00:00:00");
    Have(Make("weekly", "", 0, 900, 95), {"a"}, clock_.Now() - kDay);
    EXPECT_THAT(Count(Pass(kDay - 1)), AllOf(Ge(96u), Le(96u + 10)));
}

TEST_F(TaskMachineTest, OnlyTheShareOrThePathThatFailedWaits) {
    HaveRealtime({"a", "b", "c"});
    // A share that fails as a whole: all of it waits, and nothing else.
    bad_ = {{"b", kRefused}};
    EXPECT_EQ(Change("b", "/deep/x"), "change b/deep/x");
    EXPECT_EQ(Change("a", "/x"), "change a/x");
    EXPECT_EQ(Change("b", "/low/x"), "");
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("share 'b' waits for the server"));
    EXPECT_EQ(stored_.size(), 2u);
    bad_.clear();
    EXPECT_EQ(Pass(15), "retry b/deep/x b/low/x");
    EXPECT_THAT(stored_, IsEmpty());
    EXPECT_EQ(machine_->WaitsFor(), "");
    EXPECT_FALSE(machine_->UntilRetry());

    // A path that fails: what else changes in the share goes at once.
    bad_ = {{"a/deep/x", kUnreadable}};
    EXPECT_EQ(Change("a", "/deep/x"), "change a/deep/x");
    EXPECT_EQ(Change("a", "/low/x"), "change a/low/x");
    EXPECT_EQ(Change("a", "/deep/x"), "");  // it may have been mended: once a minute at most
    bad_.clear();
    EXPECT_EQ(Pass(35), "retry a/deep/x");
    EXPECT_THAT(stored_, IsEmpty());

    // A share that is always busy is tried at least about once a minute.
    bad_ = {{"c", kBusy}};
    Change("c", "/x");
    EXPECT_THAT(Count(Pass(600)), AllOf(Ge(9u), Le(15u)));
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("until fewer files change"));

    // A task with a schedule tries the shares that failed again, not the others.
    Have(Make("manual", "", 0), {"a", "b", "c"});
    bad_ = {{"b", kRefused}, {"c", kAway}};
    EXPECT_EQ(Ask(), "request a/ b/ c/");
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("share 'b' and 1 other share wait for the server"));
    bad_.clear();
    EXPECT_EQ(Pass(kDay), "retry b/ c/");
}

TEST_F(TaskMachineTest, WhatHasComeBackIsTriedAtOnceButNotAllTheTime) {
    bool is_there = false;
    const auto recover = [&](Recovery what) {
        machine_->Recovered({what}, [&](const std::string&) { return is_there; });
        return Pass(0);
    };
    Have(Make("manual", "", 0));
    bad_ = {{"a", kAway}};
    EXPECT_EQ(Ask(), "request a/");
    EXPECT_THAT(Count(Pass(700)), Ge(5u));
    EXPECT_THAT(machine_->WaitsFor(), HasSubstr("share 'a' waits for the volume"));
    EXPECT_EQ(recover(Recovery::kVolume), "") << "another share's";
    is_there = true;
    EXPECT_EQ(recover(Recovery::kNetwork), "");
    EXPECT_EQ(recover(Recovery::kVolume), "retry a/");

    // A network that comes and goes: between two tries lies the first wait.
    for (const bool whole : {true, false}) {
        Have(Make("manual", "", 0));
        bad_ = {{"a", kBroken}};
        down_ = whole ? std::optional(kDown) : std::nullopt;
        Ask();
        Pass(700);
        EXPECT_EQ(recover(Recovery::kVolume), "");
        size_t tries = 0;
        for (int i = 0; i < 120; ++i) {
            tries += Count(recover(i % 2 ? Recovery::kNetwork : Recovery::kSettings));
            tries += Count(Pass(1));
        }
        EXPECT_THAT(tries, AllOf(Ge(11u), Le(13u)));
    }
}

TEST_F(TaskMachineTest, WhatAPersonCancelsIsOver) {
    Have(Make("weekly", "", 8));
    EXPECT_FALSE(machine_->Cancelled());
    hold_ = true;
    EXPECT_EQ(Ask(), "request a/");
    EXPECT_EQ(Ask(), "");
    EXPECT_TRUE(machine_->Cancelled());
    down_ = {FailureKind::kCancelled, 20, "cancelled", Reach::kRun};
    End();
    EXPECT_EQ(machine_->Last()->result, ZEL::TASK_RESULT_CANCELLED);
    EXPECT_EQ(Pass(3600), "");
    for (const programs::RunFailure& failure :
         {kDown, kTalkative}) {  // one that waits for its retry
        down_ = failure;
        EXPECT_EQ(Ask(), "request a/");
        EXPECT_LE(machine_->Last()->error.size() + machine_->Last()->details.size(), 50000U);
        EXPECT_TRUE(machine_->Cancelled());
        EXPECT_FALSE(machine_->UntilRetry());
        EXPECT_EQ(Pass(3600), "");
    }
    down_.reset();
    no_room_ = true;  // one that waits for its turn
    Pass(kDay);
    EXPECT_NE(machine_->DueSince(), 0);
    EXPECT_TRUE(machine_->Cancelled());
    no_room_ = false;
    EXPECT_EQ(Pass(3600), "");

    // A realtime task's changes wait for the next one.
    HaveRealtime();
    down_ = kDown;
    EXPECT_EQ(Change("a", "/x"), "change a/x");
    EXPECT_TRUE(machine_->Cancelled());
    down_.reset();
    EXPECT_EQ(Pass(kDay), "");
    EXPECT_EQ(Change("a", "/y"), "change a/x a/y");
}

// ---- The two states of a share ----

TEST_F(TaskMachineTest, ChangesAreSentOnceItIsQuietAndAFloodAllTheSame) {
    Have(Make("realtime", "", 0), {"a", "b"});
    EXPECT_EQ(State(), ShareState::kUnknown);
    no_room_ = true;  // as while the folders are found
    Pass(5);
    no_room_ = false;
    EXPECT_EQ(Pass(0), "change a/ b/");
    EXPECT_EQ(State(), ShareState::kTracked);
    for (int i = 0; i < 5; ++i) {
        machine_->Changed("a", "/" + std::to_string(i % 2));
        clock_.elapsed += 900;
        EXPECT_EQ(Pass(0), "");
    }
    EXPECT_EQ(Pass(1), "change a/0 a/1");
    std::string sent;
    for (int i = 0; i < 29; ++i) {
        machine_->Changed("b", "/x");
        clock_.elapsed += 500;
        sent += Pass(0);
    }
    EXPECT_EQ(sent, "change b/x");
    // While it waits for its turn, changes are stored all the same.
    Pass(2);
    no_room_ = true;
    Change("a", "/x");
    Change("b", "/x");
    EXPECT_EQ(stored_.size(), 2u);
}

// What a run has found at a path may have gone from there before it was sent: a folder that is
// moved meanwhile is compared with the server's, and not with what is believed to be there.
TEST_F(TaskMachineTest, WhatIsMovedDuringARunIsNotTakenForWhatTheServerHas) {
    HaveRealtime();
    const auto move = [&](const std::string& from, const std::string& to) {
        machine_->Moved("a", from, to);
        return Pass(1);
    };
    EXPECT_EQ(move("/b/", "/c"), "change a/b a/c /b>/c?") << "some of its time is not heard";
    machine_->HeardAll();
    EXPECT_EQ(move("/c/", "/d"), "change a/c a/d /c>/d!");
    machine_->HeardAll();
    hold_ = true;
    EXPECT_EQ(Change("a", "/d/x"), "change a/d/x");
    machine_->HeardAll();
    EXPECT_EQ(move("/d/", "/e"), "");
    EXPECT_EQ(End() + Pass(1), "change a/d a/e /d>/e?");
    // Nor one whose first step was.
    machine_->HeardAll();
    hold_ = true;
    EXPECT_EQ(Change("a", "/e/x"), "change a/e/x");
    machine_->Moved("a", "/e/", "/f");
    hold_ = false;
    machine_->Ended({}, {});
    machine_->HeardAll();
    EXPECT_EQ(move("/f/", "/g"), "change a/e a/f a/g /e>/g?");
}

// What is moved need not be looked at as long as nothing was told of anything in it.
TEST_F(TaskMachineTest, WhatIsTouchedBeforeOrAfterItIsMovedIsLookedAt) {
    HaveRealtime();
    const auto move = [&](const std::string& from, const std::string& to) {
        machine_->HeardAll();
        machine_->Moved("a", from, to);
    };
    const auto change = [&](const std::string& path) { machine_->Changed("a", path); };
    const struct {
        std::function<void()> what;
        const char* sent;
    } cases[] = {
        {[&] { move("/f/", "/g/h"); }, "change a/f a/g/h /f>/g/h!"},
        {[&] { move("/f/", "/g"), move("/g/", "/h"); }, "change a/f a/g a/h /f>/h!"},
        {[&] { move("/f/", "/g"), move("/b/", "/c"); }, "change a/b a/c a/f a/g /f>/g! /b>/c!"},
        {[&] { change("/e"), move("/f/", "/g"), change("/gg"); }, "change a/e a/f a/g a/gg /f>/g!"},
        {[&] { change("/f/x/y"), move("/f/", "/g"); }, "change a/f a/g /f>/g"},
        {[&] { move("/f/", "/g"), change("/g/x/y"); }, "change a/f a/g /f>/g"},
        {[&] { move("/f/", "/g/h"), change("/g"); }, "change a/f a/g /f>/g/h"},
        {[&] { move("/f/", "/g"), change("/g/x"), move("/g/", "/h"); }, "change a/f a/g a/h /f>/h"},
        {[&] { move("/f/", "/g"), move("/g/x/", "/x"); }, "change a/f a/g a/x /f>/g /g/x>/x"},
        {[&] { move("/f/", "/g"), machine_->Lost("a", false), Search(); }, "change a/ /f>/g"},
    };
    for (const auto& one : cases) {
        one.what();
        EXPECT_EQ(Pass(1), one.sent);
    }
    // What has failed, and waits, may be of it.
    bad_ = {{"a/f/x", kRefused}};
    EXPECT_EQ(Change("a", "/f/x"), "change a/f/x");
    bad_.clear();
    move("/f/", "/g");
    EXPECT_EQ(Pass(15), "retry a/f a/g /f>/g");
}

TEST_F(TaskMachineTest, ALossOfTheWatchOrAFailedResyncLeadsToAResync) {
    HaveRealtime({"a", "b"});
    machine_->Lost("a", false);
    Search();
    EXPECT_EQ(State("a"), ShareState::kUnknown);
    EXPECT_EQ(State("b"), ShareState::kTracked);
    EXPECT_EQ(Change("b", "/x"), "change a/ b/x");
    machine_->Watched("b");  // at another place, say
    hold_ = true;
    EXPECT_EQ(Pass(0), "change b/");
    machine_->Lost("b", false);  // while it is resynced
    bad_ = {{"b", kRefused}};
    EXPECT_EQ(End(), "");
    EXPECT_EQ(State("b"), ShareState::kUnknown);
    EXPECT_EQ(Change("b", "/y"), "");
    EXPECT_EQ(stored_.size(), 1u);
    bad_.clear();
    EXPECT_EQ(Pass(15), "retry b/");
    EXPECT_EQ(State("b"), ShareState::kTracked);
    EXPECT_THAT(stored_, IsEmpty());
    // What a receiver that died has left is compared away.
    bad_ = {{"b", kBroken}};
    EXPECT_EQ(Change("b", "/z"), "change b/z");
    bad_.clear();
    EXPECT_EQ(Pass(15), "retry b/");
    // A run that fails as a whole leaves everything as it was.
    down_ = kDown;
    EXPECT_EQ(Change("a", "/x"), "change a/x");
    machine_->Lost("b", false);
    EXPECT_EQ(Pass(15), "retry a/x b/");
    EXPECT_EQ(State("a"), ShareState::kTracked);
    EXPECT_EQ(State("b"), ShareState::kUnknown);
    down_.reset();
    EXPECT_EQ(Pass(30), "retry a/x b/");
}

TEST_F(TaskMachineTest, WhatIsNotWatchedIsResyncedNowAndThen) {
    HaveRealtime({"a", "b"});
    machine_->Lost("a", true);
    EXPECT_EQ(Pass(1), "change a/");
    EXPECT_EQ(Pass(1798), "change a/");
    EXPECT_EQ(rescans_, 1);
    machine_->Covered("a");
    EXPECT_EQ(Pass(kDay), "");
    machine_->Lost("a", true);
    Pass(0);
    hold_ = true;
    Ask();
    machine_->Cancelled();
    End();
    EXPECT_EQ(Pass(kDay), "") << "before something changes, or a person asks";
    EXPECT_EQ(Ask(), "request a/ b/");
    EXPECT_EQ(Pass(1000), "change a/");
    Pause(true);
    EXPECT_EQ(Pass(kDay), "");
    Pause(false);
    EXPECT_EQ(Pass(kDay), "change a/ b/");
}

TEST_F(TaskMachineTest, WhatIsWatchedIsComparedWholeEveryWeekUnlessSet) {
    HaveRealtime({"a", "b"});
    const int64_t first = machine_->Record().compared;
    EXPECT_GT(first, 0);
    Pass(kDay);
    machine_->Lost("b", false);
    EXPECT_EQ(Pass(0), "change b/");
    EXPECT_EQ(machine_->Record().compared, first) << "not all of it";
    bad_ = {{"a", kRefused}};
    EXPECT_EQ(Pass(6 * kDay), "change a/");
    bad_.clear();
    EXPECT_EQ(Pass(kDay), "retry a/, change b/");
    EXPECT_GE(machine_->Record().compared, first + 7 * kDay);
    zel_daemon::TaskRecord never = machine_->Record();
    never.own["compare_days"] = 0;
    machine_->Edited(never);
    EXPECT_EQ(Pass(0), "change a/ b/");
    EXPECT_EQ(Pass(100 * kDay), "");
}

TEST_F(TaskMachineTest, AfterARestartAllIsResyncedAndWhatWasCutOffMadeUpFor) {
    HaveRealtime();
    down_ = kDown;
    Change("a", "/x");
    const auto stored = stored_;
    const zel_daemon::RunRecord failed = *machine_->Last();
    down_.reset();
    HaveRealtime();
    stored_ = stored;
    machine_->Restored(true, failed);
    EXPECT_EQ(Pass(0), "");
    EXPECT_EQ(Pass(15), "retry a/");
    EXPECT_THAT(stored_, IsEmpty());
    Have(Make("manual", "", 0));
    machine_->Restored(false, failed);
    EXPECT_EQ(Pass(15), "retry a/");
    machine_->Edited(machine_->Record());
    EXPECT_EQ(Pass(kDay), "");

    // What the index of a share tells is all that is sent, and until it is due, nothing is
    // compared.
    indexed_ = clock_.Now() - 3 * kDay;
    Have(Make("realtime", "", 0), {"a", "b"});
    machine_->Restored(true, failed);
    stored_ = {{{"a", "/stored"}, 1}};
    EXPECT_FALSE(machine_->IsAtRest("b"));
    const uint64_t before = machine_->ToSearch().at("b");
    machine_->Lost("b", false);  // while it is searched
    machine_->Searched("b", before, indexed_);
    EXPECT_EQ(machine_->ToSearch().count("b"), 1u) << "that search came too early";
    machine_->Changed("b", "/found");
    EXPECT_EQ(Pass(15), "retry a/stored b/found");
    EXPECT_EQ(Pass(4 * kDay), "change a/ b/");
    machine_->Lost("a", false);
    machine_->Differs("a");
    EXPECT_EQ(Pass(0), "change a/");
    Pause(true);
    Pause(false);
    EXPECT_EQ(Pass(1), "");
    // A run that failed has nothing left to do.
    machine_->Restored(false, failed);
    EXPECT_EQ(Pass(0), "");
    EXPECT_FALSE(machine_->UntilRetry());
}

// ---- The store ----

TEST_F(TaskMachineTest, AStoreThatCannotBeWrittenForAWhileLosesNothing) {
    HaveRealtime();
    disk_full_ = true;
    EXPECT_EQ(Change("a", "/one"), "");
    EXPECT_EQ(machine_->StoreProblem(), "the disk is full");
    EXPECT_EQ(Pass(20), "");
    disk_full_ = false;
    EXPECT_EQ(Pass(10), "change a/one");
    EXPECT_EQ(machine_->StoreProblem(), "");

    for (const bool fails : {false, true}) {  // when a run ends
        hold_ = true;
        EXPECT_EQ(Change("a", "/two"), "change a/two");
        down_ = fails ? std::optional(kDown) : std::nullopt;
        disk_full_ = true;
        End();
        down_.reset();
        Change("a", "/three");
        EXPECT_EQ(Pass(60), "") << "before that end is stored";
        disk_full_ = false;
        EXPECT_EQ(Pass(10), fails ? "retry a/three a/two" : "change a/three");
        EXPECT_THAT(stored_, IsEmpty());
    }

    Have(Make("weekly", "", 8), {"a", "b"});  // when a run begins
    clock_.Set("2015-03-21 07:59:59");
    disk_full_ = true;
    EXPECT_EQ(Pass(60), "");
    EXPECT_FALSE(machine_->Running());
    disk_full_ = false;
    EXPECT_EQ(Pass(10), "schedule a/ b/");
    EXPECT_EQ(machine_->Record().checked_until, Utc("2015-03-21 08:01:00"));
}

TEST(SystemClock, GoesOnAndTwoTasksDoNotRetryAtTheSameMoment) {
    const zel_daemon::SystemClock clock;
    const int64_t start = clock.Elapsed();
    zel_daemon::TaskPlan one(clock, ZEL::Schedule(), 0), other(clock, ZEL::Schedule(), 0);
    for (int i = 0; i < 10; ++i) {
        one.Failed({}), other.Failed({});
    }
    EXPECT_NE(*one.RetryAt() / 50, *other.RetryAt() / 50);
    usleep(20000);
    EXPECT_NEAR(static_cast<double>(clock.Elapsed() - start), 20, 15);
    EXPECT_NEAR(static_cast<double>(clock.Now()), static_cast<double>(time(nullptr)), 1);
}

}  // namespace

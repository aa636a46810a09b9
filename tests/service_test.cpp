// What the daemon runs when, on a clock that the test sets, against a server that the test plays.
#include "programs/zel_daemon/service.h"

#include <mutex>

#include "programs/zel_daemon/task_map.h"
#include "tests/integration/client_and_server.h"
#include "tests/support/full_disk.h"
#include "tests/support/schedules.h"
#include "tests/support/testing.h"

namespace {

using namespace test;
using std::chrono::milliseconds;
using std::chrono::steady_clock;
using namespace testing;
using zel_daemon::RunRecord;

/// What the server does with copies.
struct Copies {
    std::atomic<bool> hold{false};  // they last until this is false
    std::atomic<int> status{0};
    std::mutex mutex;
    std::map<std::string, std::pair<int, TARQ::Backup::RunCause>> bad;  // by module or source's end
    std::vector<std::string> sources;                                   // what was copied, in order
    std::map<std::string, int> running;  // by module, under the mutex as what follows
    std::atomic<int> at_a_time{0};
    int most_at_a_time = 0;
    bool share_shared = false;  // one share was copied twice at the same time

    int Copy(const std::string& module, const std::string& source, TARQ::Backup::RunReport& report,
             const std::function<bool()>& cancelled) {
        {
            const std::lock_guard<std::mutex> lock(mutex);
            sources.push_back(source);
            for (const auto& [what, fault] : bad) {
                if (module == what || (what[0] == '/' && source.find(what) != std::string::npos)) {
                    report.cause = fault.second;
                    return fault.first;
                }
            }
        }
        Count(module, 1);
        bool ended = false;
        while (hold && !ended) {
            std::this_thread::sleep_for(milliseconds(1));
            ended = cancelled();
        }
        Count(module, -1);
        return ended ? int{TARQ::Backup::STATUS_CANCELLED} : status.load();
    }
    void Count(const std::string& module, int change) {
        const std::lock_guard<std::mutex> lock(mutex);
        share_shared = (running[module] += change) > 1 || share_shared;
        at_a_time += change;
        most_at_a_time = std::max<int>(most_at_a_time, at_a_time);
    }
};
Copies* copies = nullptr;

}  // namespace

// ---- The wrapper in front of the real one: every command is done, copies are as the test says
// ----

namespace TARQ {
namespace Backup {

struct RsyncWrapper::Impl {
    std::string module;
    std::string source;
    std::list<std::string> command;
    RunReport* report = nullptr;
};

RsyncWrapper::RsyncWrapper() : impl_(new Impl) {}
RsyncWrapper::~RsyncWrapper() = default;
#define IGNORE_BOOL(name) \
    void RsyncWrapper::name(bool) {}
IGNORE_BOOL(setDelete)
IGNORE_BOOL(setNumericIds)
IGNORE_BOOL(setTarqPseudoRoot)
IGNORE_BOOL(setSsh)
IGNORE_BOOL(setCompress)
IGNORE_BOOL(setDeltaCopy)
IGNORE_BOOL(setListOnly)
IGNORE_BOOL(setRelativePath)
IGNORE_BOOL(setTarqAcl)
IGNORE_BOOL(setDebugLog)
void RsyncWrapper::setTarqAuth(bool, bool) {}
void RsyncWrapper::setPort(int) {}
void RsyncWrapper::setTimeout(int) {}
void RsyncWrapper::setExcludeRule(const std::list<std::string>&) {}
void RsyncWrapper::setSrcPath(const std::string& path) {
    impl_->source = path;
}
void RsyncWrapper::logError() {}
void RsyncWrapper::setTarqCustCmdRule(const std::list<std::string>& lines) {
    impl_->command = lines;
}
void RsyncWrapper::setDestPath(const std::string&, const std::string&, const std::string&,
                               const std::string& module, const std::string&) {
    impl_->module = module;
}
void RsyncWrapper::setRunOptions(const RunOptions& options) {
    impl_->report = options.report;
}
int RsyncWrapper::execute(const std::function<bool()>& cancelled) {
    if (impl_->command.empty()) {
        RunReport& report = *impl_->report;
        return report.status = copies->Copy(impl_->module, impl_->source, report, cancelled);
    }
    for (const std::string& line : impl_->command) {
        if (line.rfind("outfile=", 0) == 0) {
            std::ofstream(line.substr(9, line.size() - 10)) << "1\n";
        }
    }
    return 0;
}

}  // namespace Backup
}  // namespace TARQ

namespace {

struct TestClock : zel_daemon::Clock {
    int64_t Now() const override { return now; }
    int64_t Elapsed() const override { return elapsed; }

    int64_t now = Utc("2015-03-20 12:00:00");
    int64_t elapsed = 1000;
};

/// Its timer rings when the test's clock is there.
class TestLoop : public zel_daemon::EventLoop {
public:
    explicit TestLoop(TestClock& clock) : clock_(clock) {}

    void SetTimer(milliseconds delay, Task task) override {
        at_ = clock_.elapsed + std::max<int64_t>(delay.count(), 0);
        task_ = std::move(task);
    }
    void ClearTimer() override { task_ = nullptr; }

    /// Goes on to the timer's moment, but not beyond `end`. False when it has rung no bell.
    bool Ring(int64_t end) {
        if (!task_ || at_ > end) {
            return false;
        }
        const int64_t step = at_ - clock_.elapsed;
        clock_.elapsed += step;
        clock_.now += (step + 999) / 1000;
        std::exchange(task_, nullptr)();
        return true;
    }

private:
    TestClock& clock_;
    int64_t at_ = 0;
    Task task_;
};

/// No thread can be started in its scope: none has memory for its stack.
class NoThreads {
public:
    NoThreads() {
        pthread_getattr_default_np(&before_);
        pthread_attr_t after = before_;
        pthread_attr_setstacksize(&after, SIZE_MAX / 4);
        pthread_setattr_default_np(&after);
    }
    ~NoThreads() { pthread_setattr_default_np(&before_); }

private:
    pthread_attr_t before_;
};

class ServiceTest : public testing::Test {
protected:
    ServiceTest() {
        copies = &copies_;
        SetZone("UTC");
        config_.workers = 2;
        config_.debounce = milliseconds(100);
        for (const std::string share : {"a", "b", "c", "d"}) {
            root_.Write("shares/" + share + "/file", "x");
            Must(Zelctl(root_.Path(), "share add " + share + " " + root_.Path("shares/" + share)));
        }
        Start();
    }
    ~ServiceTest() override {
        service_.reset();
        SetZone("UTC");
    }

    void Start() {
        service_.reset();
        store_.reset();
        loop_ = std::make_unique<TestLoop>(clock_);
        store_ = std::make_unique<zel_daemon::Store>(root_.Path("store/tasks.db"));
        service_ = std::make_unique<zel_daemon::Service>(*loop_, clock_, *store_, config_, [] {});
        service_->Start();
        Settle();
    }
    void Add(const std::string& name, const char* mode = "weekly",
             const std::list<std::string>& shares = {"a"}) {
        zel_daemon::TaskRecord record;
        ZEL::TaskInfo& info = record.task.GetInfo();
        info.SetName(name);
        info.SetShareList(shares);
        info.SetSchedule(Make(mode, "1111111", 8));
        ZEL::SyncInfo server;
        server.SetServerIP("127.0.0.1");
        server.SetUser("alice");
        info.SetSyncInfo(server);
        service_->Add(record);
        Settle();
    }
    zel_daemon::TaskState State(const std::string& name) const {
        return service_->StateOf(service_->Find(name));
    }
    /// Until nothing moves any more but the copies that are held.
    void Settle() {
        const auto limit = steady_clock::now() + std::chrono::seconds(60);
        int quiet = 0;
        while (quiet < 3 && steady_clock::now() < limit) {
            const bool moved = loop_->RunOnce(milliseconds(2));
            const bool held =
                copies_.hold && service_->Stats().running == static_cast<size_t>(copies_.at_a_time);
            quiet = moved || !(service_->Stats().running == 0 || held) ? 0 : quiet + 1;
        }
        EXPECT_LT(steady_clock::now(), limit);
    }
    /// Lets time pass; whatever is due meanwhile is begun by the service's own timer.
    void Pass(int64_t seconds) {
        const int64_t end = clock_.elapsed + seconds * 1000;
        const int64_t now_at_end = clock_.now + seconds;
        for (int i = 0; loop_->Ring(end); ++i) {
            ASSERT_LT(i, 10000) << "it goes round and round";
            Settle();
        }
        clock_.elapsed = end;
        clock_.now = now_at_end;
    }
    /// Somebody sets the clock.
    void Jump(int64_t seconds) {
        clock_.now += seconds;
        service_->Refresh();
        Settle();
    }
    void RequestRun() {
        service_->RequestRun("t");
        Settle();
    }
    /// The starts of the runs that are new since the last call, oldest first, as "time reason".
    std::vector<std::string> NewRuns() {
        static const char* const reasons[] = {" schedule", " change", " request", " retry"};
        std::vector<std::string> texts;
        const std::vector<RunRecord> runs = service_->Runs("t", 100);
        for (const RunRecord& run : runs) {
            if (run.id > seen_) {
                texts.insert(texts.begin(), UtcText(run.start).substr(0, 16) +
                                                reasons[static_cast<int>(run.reason)]);
            }
        }
        seen_ = runs.empty() ? 0 : runs.front().id;
        return texts;
    }

    static constexpr int64_t kDay = int64_t{24} * 3600;

    TempRoot root_;
    TestClock clock_;
    Copies copies_;
    zel_daemon::DaemonConfig config_;
    std::unique_ptr<TestLoop> loop_;
    std::unique_ptr<zel_daemon::Store> store_;
    std::unique_ptr<zel_daemon::Service> service_;
    uint64_t seen_ = 0;  // the number of the last one
};

TEST_F(ServiceTest, ClocksAndZonesThatJumpMakeUpForOneRunAndLoseNone) {
    Add("t");
    Pass(2 * kDay);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-21 08:00 schedule", "2015-03-22 08:00 schedule"));
    Jump(30 * kDay);  // 2015-04-21 12:00
    EXPECT_THAT(NewRuns(), ElementsAre("2015-04-21 12:00 schedule"));
    Jump(-10 * kDay);  // 2015-04-11 12:00
    EXPECT_THAT(NewRuns(), IsEmpty());
    Pass(kDay);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-04-12 08:00 schedule"));
    Jump(-30);  // set right: 08:00 does not come twice
    SetZone("Asia/Tokyo");
    service_->Refresh();
    Pass(kDay);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-04-12 23:00 schedule"));
}

TEST_F(ServiceTest, WhatWasMissedOrCutOffWhileTheDaemonWasOffIsMadeUpForOnce) {
    Add("t");
    service_.reset();
    clock_.now += 3 * kDay;
    clock_.elapsed = 5;  // the machine was started anew
    Start();
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-23 12:00 schedule"));
    Pass(kDay);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-24 08:00 schedule"));

    copies_.hold = true;
    Pass(kDay - 3600);  // to 2015-03-25 11:00
    EXPECT_EQ(service_->Stats().running, 1u);
    service_.reset();
    copies_.hold = false;
    Start();
    EXPECT_THAT(State("t").last->error, HasSubstr("the daemon was stopped"));
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_FAILED);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-25 08:00 schedule"));
    Pass(15);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-25 11:00 retry"));
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_SUCCESS);
}

TEST_F(ServiceTest, APausedTaskRunsForAPersonAlone) {
    Add("t");
    service_->SetPaused("t", true);
    Pass(2 * kDay);
    RequestRun();
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-22 12:00 request"));
    Start();
    service_->SetPaused("t", false);
    Settle();
    EXPECT_THAT(NewRuns(), IsEmpty());
    Pass(kDay);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-23 08:00 schedule"));
}

TEST_F(ServiceTest, ACancelEndsARunAndARetryForGood) {
    Add("t");
    copies_.hold = true;
    RequestRun();
    service_->Cancel("t");
    for (int i = 0; i < 6000 && service_->Stats().running > 0; ++i) {
        loop_->RunOnce(milliseconds(5));
    }
    copies_.hold = false;
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_CANCELLED);
    EXPECT_FALSE(State("t").retry_in);
    EXPECT_THROW(service_->Cancel("t"), zel_daemon::RequestError);

    copies_.status = TARQ::Backup::STATUS_PROTOCOL_STREAM;
    RequestRun();
    EXPECT_GT(State("t").retry_in.value_or(0), 0);
    Pass(50);  // after 10 s, after 20 s more, and not yet after 40 s more, a fifth more or less
    EXPECT_EQ(NewRuns().size(), 4u);
    service_->Cancel("t");
    EXPECT_FALSE(State("t").retry_in);
    copies_.status = 0;
    Pass(kDay);
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-21 08:00 schedule"));
}

TEST_F(ServiceTest, NoShareIsCopiedTwiceAtATimeAndNoMoreTasksRunThanWorkers) {
    copies_.hold = true;
    const std::map<std::string, std::list<std::string>> tasks = {
        {"1", {"a"}}, {"2", {"b", "a"}}, {"3", {"c"}}, {"4", {"d"}}};
    for (const auto& [name, shares] : tasks) {
        Add(name, "manual", shares);
    }
    for (const auto& [name, shares] : tasks) {
        service_->RequestRun(name);
    }
    Settle();
    EXPECT_EQ(State("2").status, ZEL::TASK_STATUS_WAITING);  // its share is in use: 3 goes first
    EXPECT_EQ(State("3").status, ZEL::TASK_STATUS_RUNNING);
    copies_.hold = false;
    Settle();
    for (const auto& [name, shares] : tasks) {
        EXPECT_EQ(State(name).last->result, ZEL::TASK_RESULT_SUCCESS) << name;
    }
    EXPECT_EQ(copies_.most_at_a_time, 2);
    EXPECT_FALSE(copies_.share_shared);
}

TEST_F(ServiceTest, OnlyWhatFailedWaitsForItsNextTry) {
    using TARQ::Backup::RunCause;
    // What was copied since the last call, without the folder that the shares are in.
    const auto copied = [&] {
        const std::lock_guard<std::mutex> lock(copies_.mutex);
        std::vector<std::string> names;
        for (const std::string& source : std::exchange(copies_.sources, {})) {
            names.push_back(source.substr(root_.Path("shares/").size()));
        }
        return names;
    };
    const auto set_bad = [&](const std::string& what, int status, RunCause cause) {
        const std::lock_guard<std::mutex> lock(copies_.mutex);
        copies_.bad = {{what, {status, cause}}};
    };
    const auto change = [&](const std::string& name) {
        root_.Write("shares/" + name, std::to_string(clock_.elapsed));
        Settle();
        Pass(1);
    };
    for (const std::string share : {"a", "b"}) {
        root_.Write("shares/" + share + "/deep/x", "x");
        root_.Write("shares/" + share + "/low/x", "x");
    }
    // A share that fails as a whole: all of it waits, and nothing else.
    set_bad("b", 12, RunCause::NONE);
    Add("t", "realtime", {"a", "b", "c"});
    EXPECT_THAT(copied(), ElementsAre("a/", "b/", "c/"));
    EXPECT_THAT(State("t").last->error, AllOf(HasSubstr("share 'b'"), Not(HasSubstr("share 'a'"))));
    EXPECT_EQ(State("t").last->status, 12);
    EXPECT_THAT(State("t").note, HasSubstr("share 'b' waits"));
    change("a/deep/x");
    change("b/deep/x");
    EXPECT_THAT(copied(), ElementsAre("a/./deep/x"));
    EXPECT_EQ(State("t").pending, 1u);
    Pass(15);
    EXPECT_THAT(copied(), ElementsAre("b/"));
    copies_.bad.clear();
    Pass(30);
    EXPECT_THAT(copied(), ElementsAre("b/"));
    EXPECT_EQ(State("t").pending, 0u);
    EXPECT_EQ(State("t").note, "");
    EXPECT_FALSE(State("t").retry_in);

    // A path that cannot be read: what else changes in the share goes at once.
    set_bad("/deep/x", 23, RunCause::UNREADABLE_SOURCE);
    change("a/deep/x");
    EXPECT_EQ(State("t").pending, 1u);
    change("a/low/x");
    change("a/deep/x");  // nothing new
    EXPECT_THAT(copied(), ElementsAre("a/./deep/x", "a/./low/x"));
    EXPECT_EQ(State("t").pending, 1u);
    Pass(12);
    EXPECT_THAT(copied(), ElementsAre("a/./deep/x"));
    copies_.bad.clear();
    Pass(25);
    EXPECT_THAT(copied(), ElementsAre("a/./deep/x"));
    EXPECT_EQ(State("t").pending, 0u);

    // A share that is busy is copied again in the same run, and then at least once a minute.
    set_bad("c", 23, RunCause::BUSY_SOURCE);
    RequestRun();
    EXPECT_THAT(copied(), ElementsAre("a/", "b/", "c/", "c/", "c/"));
    Pass(600);
    EXPECT_THAT(copied().size(), AllOf(Ge(3u * 9), Le(3u * 15)));
    copies_.bad.clear();
    Pass(73);
    EXPECT_THAT(copied(), ElementsAre("c/"));
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_SUCCESS);
}

TEST_F(ServiceTest, AScheduledTaskTriesAgainOnlyTheSharesThatFailed) {
    copies_.bad = {{"b", {12, TARQ::Backup::RunCause::NONE}}};
    Add("t", "manual", {"a", "b", "c"});
    RequestRun();
    EXPECT_EQ(copies_.sources.size(), 3u);
    copies_.bad.clear();
    Pass(15);
    ASSERT_EQ(copies_.sources.size(), 4u);
    EXPECT_THAT(copies_.sources.back(), EndsWith("/b/"));
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_SUCCESS);
    EXPECT_FALSE(State("t").retry_in);
    Pass(kDay);
    EXPECT_EQ(copies_.sources.size(), 4u);
}

TEST_F(ServiceTest, WhatHasComeBackIsTriedAtOnceButNotAllTheTime) {
    using zel_daemon::Recovery;
    const std::string folder = root_.Path("shares/a");
    Add("t", "manual");
    fs::rename(folder, folder + ".away");
    RequestRun();
    Pass(700);
    const size_t tries = NewRuns().size();
    EXPECT_GE(State("t").retry_in.value_or(0), 60);
    EXPECT_THAT(State("t").note, HasSubstr("share 'a' waits for the volume"));
    service_->MayHaveRecovered(Recovery::kVolume);  // of another share's
    service_->MayHaveRecovered(Recovery::kNetwork);
    Pass(5);
    EXPECT_THAT(NewRuns(), IsEmpty());
    fs::rename(folder + ".away", folder);
    service_->MayHaveRecovered(Recovery::kVolume);
    Pass(2);
    EXPECT_EQ(NewRuns().size(), 1u);
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_SUCCESS);
    EXPECT_GE(tries, 5u);

    // A network that comes and goes, and a server that is not there.
    {
        const std::lock_guard<std::mutex> lock(copies_.mutex);
        copies_.bad = {{"a", {12, TARQ::Backup::RunCause::NONE}}};
    }
    RequestRun();
    Pass(700);
    NewRuns();
    for (int i = 0; i < 120; ++i) {
        service_->MayHaveRecovered(Recovery::kNetwork);
        Pass(1);
    }
    EXPECT_THAT(NewRuns().size(), AllOf(Ge(9u), Le(13u)));
}

TEST_F(ServiceTest, WithoutAThreadARunFailsAndIsMadeLater) {
    Add("t", "manual");
    {
        const NoThreads none;
        RequestRun();
        EXPECT_THAT(State("t").last->error, HasSubstr("TasksMax="));
        EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_FAILED);
    }
    Pass(15);
    EXPECT_THAT(NewRuns(), ElementsAre(HasSubstr("request"), HasSubstr("retry")));
    EXPECT_EQ(State("t").last->result, ZEL::TASK_RESULT_SUCCESS);
}

TEST_F(ServiceTest, AStoreThatCannotBeWrittenForAWhileLosesNothing) {
    Add("t", "realtime");
    EXPECT_THAT(NewRuns(), ElementsAre("2015-03-20 12:00 change"));
    const auto change = [&](const std::string& name) {
        root_.Write("shares/a/" + name, "x");
        Settle();
        Pass(1);
    };
    {
        const FullDisk full;  // from the change on
        change("one");
        EXPECT_THAT(State("t").note, HasSubstr("the disk is full"));
        Pass(20);
        EXPECT_THAT(NewRuns(), IsEmpty());
    }
    Pass(15);
    EXPECT_EQ(NewRuns().size(), 1u);
    EXPECT_EQ(State("t").note, "");

    for (const int status : {0, int{TARQ::Backup::STATUS_PROTOCOL_STREAM}}) {
        copies_.hold = true;
        copies_.status = 0;
        change(status == 0 ? "two" : "three");
        ASSERT_EQ(service_->Stats().running, 1u);
        {
            const FullDisk full;  // when the run ends
            copies_.status = status;
            copies_.hold = false;
            Settle();
            EXPECT_THAT(State("t").note, HasSubstr("the disk is full"));
            EXPECT_EQ(State("t").pending, 1u);
        }
        copies_.status = 0;
        Pass(60);
        EXPECT_EQ(State("t").pending, 0u);
        EXPECT_EQ(State("t").note, "");
        EXPECT_EQ(NewRuns().size(), status == 0 ? 1u : 2u);  // what failed was sent again
        for (const RunRecord& run : service_->Runs("t", 100)) {
            EXPECT_NE(run.end, 0);
        }
    }

    {
        const FullDisk full;  // when a run is to begin
        RequestRun();
        EXPECT_THAT(NewRuns(), IsEmpty());
    }
    Pass(15);
    EXPECT_THAT(NewRuns(), ElementsAre(HasSubstr("request")));
}

}  // namespace

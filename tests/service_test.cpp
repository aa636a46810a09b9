// What the service adds to its tasks' machines: who runs when, what is stored and what is watched,
// on a clock that the test sets, against a server that listens and says nothing, or is away.
#include "programs/zel_daemon/service.h"

#include <netinet/in.h>
#include <pthread.h>
#include <sys/socket.h>

#include "programs/zel_daemon/task_map.h"
#include "tests/integration/client_and_server.h"
#include "tests/support/full_disk.h"
#include "tests/support/test_clock.h"
#include "tests/support/testing.h"

namespace {

using namespace test;
using std::chrono::milliseconds;
using std::chrono::steady_clock;
using namespace testing;
using zel_daemon::RunRecord;

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
        clock_.elapsed = at_;
        std::exchange(task_, nullptr)();
        return true;
    }

private:
    TestClock& clock_;
    int64_t at_ = 0;
    Task task_;
};

class ServiceTest : public testing::Test {
protected:
    ServiceTest() {
        SetZone("UTC");
        config_.debounce = milliseconds(100);
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t size = sizeof address;
        bind(server_.Get(), reinterpret_cast<sockaddr*>(&address), size);
        getsockname(server_.Get(), reinterpret_cast<sockaddr*>(&address), &size);
        root_.Write("usr/tarq/etc/tarqrsync.conf",
                    "[rsync]\nport=\"" + std::to_string(ntohs(address.sin_port)) + "\"\n");
        for (const std::string share : {"a", "b", "c", "d"}) {
            root_.Write("shares/" + share + "/file", "x");
            Must(Zelctl(root_.Path(), "share add " + share + " " + root_.Path("shares/" + share)));
        }
        Start();
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
    /// From now on the server keeps whoever asks it waiting; before that, nobody is there.
    void StartServer() {
        ASSERT_EQ(listen(server_.Get(), 100), 0);
        is_there_ = true;
    }
    void Add(const std::string& name, const char* mode = "manual",
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
    void Write(const std::string& name) {
        root_.Write("shares/a/" + name, "x");
        Settle();
        Pass(1);
    }
    void RequestRun() {
        service_->RequestRun("t");
        Settle();
    }
    zel_daemon::TaskState State(const std::string& name = "t") const {
        return service_->StateOf(service_->Find(name));
    }
    bool Runs(const std::string& name) const {
        return State(name).status == ZEL::TASK_STATUS_RUNNING;
    }
    void Cancel(const std::string& name) {
        service_->Cancel(name);
        const uint64_t run = State(name).run;
        for (int i = 0; i < 6000 && State(name).run == run; ++i) {
            loop_->RunOnce(milliseconds(5));
        }
        EXPECT_EQ(State(name).last->result, ZEL::TASK_RESULT_CANCELLED);
    }
    /// Until nothing moves any more.
    void Settle() {
        const auto limit = steady_clock::now() + std::chrono::seconds(60);
        for (int quiet = 0; quiet < 3 && steady_clock::now() < limit;) {
            const bool moved = loop_->RunOnce(milliseconds(2));
            quiet = moved || (service_->Stats().running != 0 && !is_there_) ? 0 : quiet + 1;
        }
        EXPECT_LT(steady_clock::now(), limit);
    }
    /// Lets time pass; whatever is due meanwhile is begun by the service's own timer.
    void Pass(int64_t seconds) {
        const int64_t end = clock_.elapsed + seconds * 1000;
        for (int i = 0; loop_->Ring(end); ++i) {
            ASSERT_LT(i, 10000) << "it goes round and round";
            Settle();
        }
        clock_.elapsed = end;
    }
    /// The reasons of the runs that are new since the last call, oldest first.
    std::vector<std::string> NewRuns() {
        static const char* const reasons[] = {"schedule", "change", "request", "retry"};
        std::vector<std::string> texts;
        for (const RunRecord& run : service_->Runs("t", 100)) {
            if (run.id > seen_) {
                texts.insert(texts.begin(), reasons[static_cast<int>(run.reason)]);
            }
        }
        seen_ = service_->Runs("t", 1).at(0).id;
        return texts;
    }

    TempRoot root_;
    TestClock clock_{"2015-03-20 12:00:00"};
    base::UniqueFd server_{socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0)};
    bool is_there_ = false;
    zel_daemon::DaemonConfig config_;
    std::unique_ptr<TestLoop> loop_;
    std::unique_ptr<zel_daemon::Store> store_;
    std::unique_ptr<zel_daemon::Service> service_;
    uint64_t seen_ = 0;  // the number of the last run
};

TEST_F(ServiceTest, NoShareIsCopiedTwiceAtATimeAndNoMoreTasksRunThanWorkers) {
    StartServer();
    const std::pair<const char*, std::list<std::string>> tasks[] = {
        {"1", {"a"}}, {"2", {"b", "a"}}, {"3", {"c"}}, {"4", {"d"}}};
    for (const auto& [name, shares] : tasks) {
        Add(name, "manual", shares);
        service_->RequestRun(name);
        clock_.elapsed += 10;
    }
    Settle();
    EXPECT_TRUE(Runs("1") && Runs("3"));  // 2 waits for its share, and 3 goes first
    EXPECT_EQ(State("2").status, ZEL::TASK_STATUS_WAITING);
    EXPECT_THROW(service_->Edit("1", service_->Find("1")), programs::Failure);
    Cancel("1");
    EXPECT_THROW(service_->Cancel("1"), programs::Failure);
    EXPECT_TRUE(Runs("2") && Runs("3"));
    EXPECT_EQ(service_->Stats().running, 2u);
    Cancel("3");
    EXPECT_TRUE(Runs("2") && Runs("4"));

    Start();  // once more: what was cut off is made up for
    EXPECT_EQ(State("1").last->result, ZEL::TASK_RESULT_CANCELLED);
    EXPECT_THAT(State("2").last->error, HasSubstr("the daemon was stopped"));
    EXPECT_EQ(service_->Stats().running, 0u);
    Pass(15);
    EXPECT_TRUE(Runs("2") && Runs("4"));
}

TEST_F(ServiceTest, WhatWasMissedWhileTheDaemonWasOffIsMadeUpForOnce) {
    Add("t", "weekly");
    service_.reset();
    clock_.Set("2015-03-23 12:00:00");
    Start();
    EXPECT_THAT(NewRuns(), ElementsAre("schedule"));
    EXPECT_THAT(State().last->error, HasSubstr("refuse"));
    service_->SetPaused("t", true);
    Start();
    Pass(48 * 3600);
    EXPECT_EQ(State().status, ZEL::TASK_STATUS_PAUSED);
    service_->SetPaused("t", false);
    RequestRun();
    EXPECT_THAT(NewRuns(), ElementsAre("request"));
    for (int i = 0; i < 3; ++i) {  // one change seldom comes alone
        service_->MayHaveRecovered(zel_daemon::Recovery::kNetwork);
    }
    EXPECT_EQ(service_->Runs("t", 1)[0].id, seen_);
    Pass(12);
    EXPECT_THAT(NewRuns(), ElementsAre("retry"));
}

TEST_F(ServiceTest, WithoutAThreadARunFailsAndIsMadeLater) {
    StartServer();
    Add("t");
    pthread_attr_t usual;
    pthread_getattr_default_np(&usual);
    pthread_attr_t huge = usual;  // stacks for which there is no memory
    pthread_attr_setstacksize(&huge, SIZE_MAX / 4 * 3);
    pthread_setattr_default_np(&huge);
    RequestRun();
    pthread_setattr_default_np(&usual);
    EXPECT_THAT(State().last->error, HasSubstr("TasksMax="));
    EXPECT_EQ(State().last->result, ZEL::TASK_RESULT_FAILED);
    Pass(15);
    EXPECT_THAT(NewRuns(), ElementsAre("request", "retry"));
    EXPECT_TRUE(Runs("t"));
}

TEST_F(ServiceTest, AStoreThatCannotBeWrittenForAWhileLosesNothing) {
    StartServer();
    Add("t", "realtime");
    ASSERT_TRUE(Runs("t"));
    {
        const FullDisk full;
        Write("one");
        EXPECT_THAT(State().note, HasSubstr("the disk is full"));
        Pass(20);
        Cancel("t");
        Write("two");
        EXPECT_EQ(State().pending, 0u);
        EXPECT_EQ(service_->Stats().running, 0u);
    }
    Pass(15);
    EXPECT_EQ(State().note, "");
    EXPECT_EQ(State().pending, 2u);
    EXPECT_THAT(NewRuns(), ElementsAre("change", "change"));
    EXPECT_NE(service_->Runs("t", 2)[1].end, 0);
    Cancel("t");
    {
        const FullDisk full;  // when a run is to begin
        RequestRun();
        EXPECT_THAT(NewRuns(), IsEmpty());
    }
    Pass(15);
    EXPECT_THAT(NewRuns(), ElementsAre("request"));
}

TEST_F(ServiceTest, WhatIsNotWatchedIsKnownToTasksThatComeLaterToo) {
    const std::string name(250, 'n');
    int at = open(root_.Path("shares/a").c_str(), O_RDONLY);
    for (int depth = 0; depth < 20; ++depth) {  // a path that is longer than can be watched
        ASSERT_EQ(mkdirat(at, name.c_str(), 0700), 0);
        const int below = openat(at, name.c_str(), O_RDONLY);
        close(at);
        at = below;
    }
    close(at);
    const auto unwatched = HasSubstr("not all of its folders can be watched");
    Add("first", "realtime");
    EXPECT_THAT(State("first").note, unwatched);
    Add("t", "realtime");
    EXPECT_THAT(State().note, unwatched);
    service_->Edit("t", service_->Find("t"));
    Settle();
    EXPECT_THAT(State().note, unwatched);
    fs::rename(root_.Path("shares/a/" + name), root_.Path("away"));
    Settle();
    RequestRun();
    EXPECT_THAT(State().note, Not(unwatched));
    EXPECT_THAT(State("first").note, Not(unwatched));
    EXPECT_TRUE(State().watch->complete);
}

}  // namespace

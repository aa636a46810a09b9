#include "programs/zel_daemon/store.h"

#include <poll.h>

#include "programs/common/failure.h"
#include "programs/zel_daemon/store_schema.h"
#include "tests/support/full_disk.h"
#include "tests/support/schedules.h"
#include "tests/support/testing.h"

namespace {

using namespace std::string_literals;
using namespace testing;
using zel_daemon::Database;
using zel_daemon::Query;
using zel_daemon::RunReason;
using zel_daemon::RunRecord;
using zel_daemon::Store;
using zel_daemon::TaskRecord;

TaskRecord Task(const std::string& name) {
    TaskRecord record;
    record.task.GetInfo().SetName(name);
    return record;
}

std::string Text(const TaskRecord& record) {
    return record.ToMap().toString() + " " + std::to_string(record.paused) + " " +
           std::to_string(record.checked_until);
}

std::string Fault(const std::function<void()>& work) {
    try {
        work();
    } catch (const programs::Failure& error) {
        return error.what();
    }
    return "none";
}

class StoreTest : public testing::Test {
protected:
    void Reopen() {
        store_.reset();
        store_ = std::make_unique<Store>(path_);
    }
    std::string OpenFault(const std::string& path) const {
        return Fault([&] { const Store store(folder_.Path(path)); });
    }
    // The waiting changes, as "share path".
    std::vector<std::string> Pending(uint64_t task) {
        std::vector<std::string> pending;
        ids_.clear();
        for (const ZEL::Event& event : store_->PendingEvents(task)) {
            pending.push_back(event.GetShareName() + " " + event.GetRelativePath());
            ids_.push_back(event.GetID());
        }
        return pending;
    }
    const test::TempFolder folder_;
    const std::string path_ = folder_.Path("daemon/tasks.db");
    std::unique_ptr<Store> store_ = std::make_unique<Store>(path_);
    std::vector<uint64_t> ids_;  // of the changes that Pending() told last
};

TEST_F(StoreTest, KeepsEveryFieldOfATask) {
    TaskRecord record;
    ZEL::PObject map = test::FullTask();
    map["user"] = "5";  // text, though it looks like a number
    map["pswd"] = "p\xff";
    map["repeat_times_in_day"] = -3;
    ZEL::PObj2SyncTask(map, record.task);
    record.task.GetInfo().SetName("n\xffi\0ghtly"s);
    record.task.GetInfo().SetShareList({"photo", "\xfe\0x"s, "it's \"q\"\n", ""});
    record.own["exclude"].asArray() = {"*.tmp", "\xff*", "#re*"};
    record.paused = true;
    record.checked_until = INT64_MAX;
    const uint64_t id = store_->AddTask(record);
    record.task.SetID(id);
    Reopen();
    ASSERT_EQ(store_->Tasks().size(), 1U);
    EXPECT_EQ(Text(store_->Tasks()[0]), Text(record));

    record.task.GetInfo().SetName("Fotos täglich");
    record.paused = false;
    store_->UpdateTask(record);
    EXPECT_EQ(Text(store_->Tasks()[0]), Text(record));
    Database database(path_);
    Query query(database, "SELECT share_list FROM tasks WHERE name = 'Fotos täglich'");
    ASSERT_TRUE(query.Next());
    EXPECT_EQ(query.Text(), R"(["photo",[254,0,120],"it's \"q\"\n",""])");
}

TEST_F(StoreTest, NamesAreUniqueAndIdsAreNeverUsedAgain) {
    const uint64_t first = store_->AddTask(Task("a"));
    const uint64_t second = store_->AddTask(Task("b"));
    EXPECT_THAT(Fault([&] { store_->AddTask(Task("a")); }),
                AllOf(HasSubstr(path_), HasSubstr("'a'"), HasSubstr("choose another")));
    TaskRecord renamed = Task("a");
    renamed.task.SetID(second);
    EXPECT_THAT(Fault([&] { store_->UpdateTask(renamed); }), HasSubstr("choose another"));
    renamed.task.SetID(second + 1);
    EXPECT_THAT(Fault([&] { store_->UpdateTask(renamed); }), HasSubstr("no such task"));
    store_->RemoveTask(second);
    EXPECT_GT(store_->AddTask(Task("b")), second);
    store_->RemoveTask(first);
    ASSERT_EQ(store_->Tasks().size(), 1U);
    EXPECT_EQ(store_->Tasks()[0].Name(), "b");
}

TEST_F(StoreTest, AChangeWaitsOnceAndOnceMoreWhileItIsBeingSent) {
    const uint64_t task = store_->AddTask(Task("a"));
    const uint64_t other = store_->AddTask(Task("b"));
    store_->AddEvents(task, "s", {"/z", "/\xff\n", "/z", "/a"});
    store_->AddEvents(task, "t", {"/z"});
    store_->AddEvents(other, "s", {"/z"});
    EXPECT_THAT(Pending(task), ElementsAre("s /z", "s /\xff\n", "s /a", "t /z"));
    const std::vector<uint64_t> ids = ids_;
    RunRecord run;
    run.id = store_->BeginRun(task, RunReason::kChange, 100, {ids[0], ids[1], ids[3]});
    store_->AddEvents(task, "s", {"/z", "/a"});
    EXPECT_THAT(Pending(task), ElementsAre("s /a", "s /z"));
    EXPECT_EQ(store_->CountEvents(task), 5U);
    store_->EndRun(run, {{ids[1]}, {ids[0], ids[3], 999}});
    EXPECT_THAT(Pending(task), ElementsAre("s /z", "s /a", "t /z"));
    EXPECT_EQ(store_->CountEvents(task), 3U);

    store_->BeginRun(task, RunReason::kChange, 200, {ids[0]});
    TaskRecord reset = Task("reset");
    reset.task.SetID(task);
    store_->ResetTask(reset);
    EXPECT_EQ(store_->Tasks()[0].Name(), "reset");
    EXPECT_EQ(store_->CountEvents(task), 0U);
    EXPECT_THAT(Pending(other), ElementsAre("s /z"));
    EXPECT_THAT(Fault([&] { store_->AddEvents(99, "s", {"/"}); }), HasSubstr("no such task"));
}

TEST_F(StoreTest, KeepsTheLastRunsOfEachTask) {
    const uint64_t task = store_->AddTask(Task("a"));
    const uint64_t other = store_->AddTask(Task("b"));
    store_->AddTask(Task("has not run"));
    const std::string error = "share 'x\xff': cannot be read";
    const uint64_t id = store_->BeginRun(task, RunReason::kRetry, 100);
    const RunRecord run = {id,         task,  RunReason::kRetry,
                           100,        160,   ZEL::TASK_RESULT_FAILED,
                           23,         error, "a\nb",
                           UINT64_MAX, 2,     3,
                           4};
    store_->EndRun(run);
    EXPECT_THAT(store_->Runs(task, 5), ElementsAre(FieldsAre(id, task, RunReason::kRetry, 100, 160,
                                                             ZEL::TASK_RESULT_FAILED, 23, error,
                                                             "a\nb", UINT64_MAX, 2, 3, 4)));

    const uint64_t others = store_->BeginRun(other, RunReason::kRequest, 50);
    uint64_t last = 0;
    for (int i = 0; i < Store::kRunsKept; ++i) {
        last = store_->BeginRun(task, RunReason::kSchedule, 200 + i);
    }
    const std::vector<RunRecord> runs = store_->Runs(task, 1000);
    ASSERT_EQ(runs.size(), Store::kRunsKept + 0U);
    EXPECT_EQ(runs.front().id, last);
    EXPECT_EQ(runs.back().start, 200);
    EXPECT_THAT(store_->LastRuns(),
                ElementsAre(Field(&RunRecord::id, last), Field(&RunRecord::id, others)));

    store_->RemoveTask(task);
    store_->EndRun(run);
    EXPECT_EQ(store_->LastRuns().size(), 1U);
    EXPECT_THAT(Fault([&] { store_->BeginRun(task, RunReason::kChange, 1); }),
                HasSubstr("no such task"));
}

TEST_F(StoreTest, WhatWasCutOffHasFailedAndWaitsAgain) {
    const uint64_t task = store_->AddTask(Task("a"));
    store_->AddEvents(task, "s", {"/a", "/b"});
    Pending(task);
    store_->BeginRun(task, RunReason::kChange, 100, ids_);
    store_->AddEvents(task, "s", {"/b"});
    Reopen();
    EXPECT_EQ(store_->Runs(task, 1).at(0).result, ZEL::TASK_RESULT_FAILED);
    EXPECT_EQ(store_->Runs(task, 1).at(0).end, 100);
    EXPECT_THAT(Pending(task), ElementsAre("s /a", "s /b"));
    EXPECT_EQ(store_->CountEvents(task), 2U);
}

TEST_F(StoreTest, IsForTheDaemonAlone) {
    store_->AddTask(Task("a"));
    EXPECT_EQ(test::ModeOf(folder_.Path("daemon")), 0700U);
    EXPECT_EQ(test::ModeOf(path_), 0600U);
    EXPECT_EQ(test::ModeOf(path_ + "-wal"), 0600U);
    store_.reset();
    chmod(path_.c_str(), 0644);
    Reopen();
    EXPECT_EQ(test::ModeOf(path_), 0600U);
}

TEST_F(StoreTest, AFileThatIsNoStoreOfThisProgramIsRefusedAndLeftAsItIs) {
    store_.reset();
    const std::string store = test::ReadFile(path_);
    std::string damaged = store;
    damaged.replace(100, 300, 300, '\x55');
    const auto made = [&](const std::string& start, const char* statement) {
        folder_.Write("daemon/tasks.db", start);
        Database(path_).Execute(statement);
        return test::ReadFile(path_);
    };
    const std::pair<std::string, const char*> cases[] = {
        {"this is no database, whatever its name says", "not a database; the file is damaged"},
        {damaged, "the file is damaged and is left as it is; stop the daemon"},
        {store.substr(0, 5000), "damaged"},
        {made(store, "PRAGMA user_version = 77"), "version 77, and this program knows versions up"},
        {made("", "CREATE TABLE bookmarks (url)"), "of another program; name another file"},
    };
    for (const auto& [content, fault] : cases) {
        folder_.Write("daemon/tasks.db", content);
        EXPECT_THAT(OpenFault("daemon/tasks.db"),
                    AllOf(HasSubstr(path_ + ": cannot open"), HasSubstr(fault)));
        EXPECT_EQ(test::ReadFile(path_) == content, true) << fault;
    }
}

TEST_F(StoreTest, AStoreThatWasLostIsNoFreshStart) {
    const auto fault = [&] {
        std::string told = "none";
        try {
            const Store store(path_);
        } catch (const programs::Failure& failure) {
            EXPECT_TRUE(failure.Kind() == programs::FailureKind::kLocal);
            told = failure.what();
        }
        return told;
    };
    store_->AddTask(Task("a"));
    // As a daemon leaves it that is killed: what was added is in the log of changes alone.
    for (const char* part : {"", "-wal"}) {
        fs::copy_file(path_ + part, folder_.Path("copy") + part);
    }
    store_.reset();
    const auto put_back = [&] {
        for (const char* part : {"", "-wal"}) {
            fs::copy_file(folder_.Path("copy") + part, path_ + part,
                          fs::copy_options::overwrite_existing);
        }
    };
    const std::pair<std::function<void()>, const char*> ways[] = {
        {[&] { fs::resize_file(path_, 0); }, "it is empty"},
        {[&] { fs::remove(path_); }, "it is gone, though it was there"},
        {[&] {
             fs::remove(path_);
             fs::remove(path_ + "-wal");
         },
         "tasks.db.made tells"},
        {[&] {
             fs::remove(path_);
             fs::remove(path_ + "-wal");
             folder_.Write("daemon/tasks.db", "");
             Database(path_).Execute("PRAGMA user_version = 1; PRAGMA user_version = 0");
         },
         "without anything in it"},
    };
    for (const auto& [lose, why] : ways) {
        put_back();
        lose();
        EXPECT_THAT(fault(), AllOf(HasSubstr(why), HasSubstr("zel_daemon --new-store")));
        EXPECT_THAT(fault(), HasSubstr(why)) << "the second time";
        // What was put back is all there.
        put_back();
        Reopen();
        EXPECT_EQ(store_->Tasks().size(), 1u) << why;
        store_.reset();
    }
    // Unless a person wants it.
    fs::resize_file(path_, 0);
    const std::string aside = Store::Renew(path_);
    EXPECT_TRUE(fs::exists(aside));
    Reopen();
    EXPECT_THAT(store_->Tasks(), IsEmpty());
    // Where making the first one was cut off there was none.
    store_.reset();
    fs::remove_all(folder_.Path("daemon"));
    folder_.Write("daemon/tasks.db.new", "half");
    EXPECT_EQ(fault(), "none");
}

TEST_F(StoreTest, AListThatSomebodyBrokeIsTold) {
    store_->AddTask(Task("a"));
    for (const char* list : {"[\"a\"", "{}", "[1]", "[[\"a\"]]", "\"a\""}) {
        Database(path_).Execute(("UPDATE tasks SET exclude = '" + std::string(list) + "'").c_str());
        EXPECT_THAT(Fault([&] { store_->Tasks(); }), HasSubstr("lists of task 1")) << list;
    }
}

TEST_F(StoreTest, AFullDiskLosesNothing) {
    const uint64_t task = store_->AddTask(Task("a"));
    store_->AddEvents(task, "s", {"/a"});
    {
        const test::FullDisk full;
        EXPECT_THAT(Fault([&] {
                        store_->AddEvents(task, "s", {"/b", "/c"});
                    }),
                    AllOf(HasSubstr(path_), HasSubstr("the disk is full; make room")));
        EXPECT_THAT(Fault([&] { store_->RemoveTask(task); }), HasSubstr("disk is full"));
        EXPECT_THAT(Pending(task), ElementsAre("s /a"));
        EXPECT_THAT(OpenFault("new/tasks.db"), HasSubstr("disk is full"));
    }
    store_->AddEvents(task, "s", {"/b"});
    EXPECT_THAT(Pending(task), ElementsAre("s /a", "s /b"));
    Reopen();
    EXPECT_EQ(store_->CountEvents(task), 2U);
    EXPECT_EQ(OpenFault("new/tasks.db"), "none");
}

TEST_F(StoreTest, AFolderThatCannotBeWrittenIsTold) {
    store_.reset();
    folder_.Write("file", "");
    EXPECT_THAT(OpenFault("file/tasks.db"),
                AllOf(HasSubstr("file/tasks.db: cannot open"), HasSubstr("may write there")));
    chmod(folder_.Path().c_str(), 0755);
    chmod(folder_.Path("daemon").c_str(), 0555);
    chmod(path_.c_str(), 0444);
    const bool root = geteuid() == 0;
    ASSERT_TRUE(!root || seteuid(65534) == 0);  // root may write anywhere
    const std::string missing = OpenFault("daemon/new.db");
    const std::string there = OpenFault("daemon/tasks.db");
    ASSERT_TRUE(!root || seteuid(0) == 0);
    EXPECT_THAT(missing, HasSubstr("user may write"));
    EXPECT_THAT(there, HasSubstr("user may write"));
}

TEST_F(StoreTest, LayoutsAreBroughtUpToDateStepByStep) {
    Database database(folder_.Write("steps.db", ""));
    const auto bring = [&](const zel_daemon::SchemaSteps& steps) {
        zel_daemon::BringUpToDate(database, steps);
        return database.Number("PRAGMA user_version") * 100 + database.Number("SELECT b FROM t");
    };
    const char* const first = "CREATE TABLE t (a); INSERT INTO t VALUES (5); ALTER TABLE t ADD b";
    const char* const second = "UPDATE t SET b = a + 1";
    const char* const broken = "UPDATE t SET b = 9; UPDATE missing SET b = 9";
    EXPECT_EQ(bring({first}), 100);
    EXPECT_EQ(bring({first}), 100);
    EXPECT_THROW(bring({first, second, broken}), zel_daemon::SqliteError);
    EXPECT_EQ(bring({first, second}), 206);
    EXPECT_THROW(bring({first}), programs::Failure);
    EXPECT_EQ(bring({first, second, "UPDATE t SET b = b + 1"}), 307);
}

// Works on the store and tells each thing once the store has taken it, as a line: "e" and a path
// that waits, "t" and one that is about to go, "g" and one that is gone; "r" and a run that began,
// "d" and one that was done.
[[noreturn]] void WorkUntilKilled(const std::string& path, int round, int out) {
    const auto tell = [&](char what, const std::string& which) {
        dprintf(out, "%c%s\n", what, which.c_str());
    };
    try {
        Store store(path);
        const std::vector<TaskRecord> tasks = store.Tasks();
        const uint64_t task = tasks.empty() ? store.AddTask(Task("a")) : tasks[0].ID();
        for (int i = 0;; ++i) {
            const std::string name = "/" + std::to_string(round) + "." + std::to_string(i);
            store.AddEvents(task, "s", {name, name + "+"});
            tell('e', name);
            tell('e', name + "+");
            const ZEL::Event last = store.PendingEvents(task).back();
            RunRecord run;
            run.id = store.BeginRun(task, RunReason::kChange, 1000, {last.GetID()});
            tell('r', std::to_string(run.id));
            zel_daemon::RunEnd end;
            if (i % 3 == 0) {
                tell('t', last.GetRelativePath());
                end.sent = {last.GetID()};
            }
            run.end = 2000;
            run.result = ZEL::TASK_RESULT_SUCCESS;
            store.EndRun(run, end);
            tell('d', std::to_string(run.id));
            if (i % 3 == 0) {
                tell('g', last.GetRelativePath());
            }
        }
    } catch (const programs::Failure& error) {
        fprintf(stderr, "%s\n", error.what());
        _exit(1);
    }
}

TEST(StoreCrash, WhatWasAnsweredIsThereWheneverTheProcessIsKilled) {
    const test::TempFolder folder;
    std::mt19937 random(static_cast<unsigned int>(getpid()));
    std::map<std::string, char> paths;  // the last that was told of each
    size_t told = 0;
    for (int round = 0; round < 60; ++round) {
        // Every fourth time the file is new: it is cut off while it is being made.
        const std::string path = folder.Path(std::to_string(round / 4) + "/tasks.db");
        if (round % 4 == 0) {
            paths.clear();
        }
        int ends[2];
        ASSERT_EQ(pipe(ends), 0);
        const pid_t child = fork();
        if (child == 0) {
            WorkUntilKilled(path, round, ends[1]);
        }
        close(ends[1]);
        struct pollfd first_line = {ends[0], POLLIN, 0};
        poll(&first_line, 1, round % 4 == 0 ? 0 : 60000);
        usleep(static_cast<useconds_t>(random() % (round % 4 == 0 ? 10000 : 50000)));
        kill(child, SIGKILL);
        std::map<uint64_t, char> runs;
        std::ifstream lines("/proc/self/fd/" + std::to_string(ends[0]));
        for (std::string line; std::getline(lines, line); ++told) {
            const std::string which = line.substr(1);
            if (line[0] == 'r' || line[0] == 'd') {
                runs[std::stoull(which)] = line[0];
            } else {
                paths[which] = line[0];
            }
        }
        close(ends[0]);
        int status = 0;
        waitpid(child, &status, 0);
        ASSERT_TRUE(WIFSIGNALED(status)) << "the child failed by itself";

        Store store(path);
        Database database(path);
        Query check(database, "PRAGMA integrity_check");
        EXPECT_TRUE(check.Next() && check.Text() == "ok");
        const std::vector<TaskRecord> tasks = store.Tasks();
        if (tasks.empty()) {
            EXPECT_THAT(paths, IsEmpty());
            continue;
        }
        const uint64_t task = tasks[0].ID();
        std::set<std::string> stored;
        for (const ZEL::Event& event : store.PendingEvents(task)) {
            stored.insert(event.GetRelativePath());
        }
        for (const auto& [name, last] : paths) {
            if (last != 't') {
                ASSERT_EQ(stored.count(name), last == 'e' ? 1U : 0U) << name << " was answered";
            }
        }
        const std::vector<RunRecord> history = store.Runs(task, 1000);
        size_t known = 0;
        for (const RunRecord& run : history) {
            EXPECT_NE(run.end, 0);
            if (const auto found = runs.find(run.id); found != runs.end()) {
                ++known;
                EXPECT_TRUE(found->second == 'r' || run.result == ZEL::TASK_RESULT_SUCCESS);
            }
        }
        EXPECT_TRUE(known == runs.size() || history.size() == Store::kRunsKept);
    }
    EXPECT_GE(told, 45U);
}

}  // namespace

// The daemon as a whole, against a real server: whatever happens on disk, to the daemon, to the
// server or on the socket, both sides are equal in the end and nothing is done needlessly.
#include <grp.h>
#include <sys/mount.h>
#include <sys/un.h>

#include "ZEL/ipc.h"
#include "ZEL/sync_obj.h"
#include "programs/zel_daemon/sqlite.h"
#include "tests/integration/client_and_server.h"
#include "tests/integration/command.h"
#include "tests/integration/daemon_process.h"
#include "tests/support/testing.h"

using std::chrono::milliseconds;
using std::chrono::steady_clock;
using test::Await;
using test::Must;
using test::Request;
using namespace testing;
using ZEL::PObject;

namespace {

/// Every entry below a folder with its content, versions left out; of a link its target, because
/// the server keeps links in files.
std::map<std::string, std::string> TreeOf(const std::string& folder) {
    std::map<std::string, std::string> tree;
    std::error_code ignored;  // what vanishes meanwhile
    for (fs::recursive_directory_iterator at(folder, ignored), end; at != end;
         at.increment(ignored)) {
        const std::string name = at->path().filename();
        if (name == ".zel_versions" || name == ".zel_partial" || name == ".versions") {
            at.disable_recursion_pending();
            continue;
        }
        std::string& content = tree[at->path().string().substr(folder.size())];
        if (at->is_symlink(ignored)) {
            content = fs::read_symlink(at->path(), ignored);
        } else {
            content = at->is_directory(ignored) ? "/" : test::ReadFile(at->path());
        }
    }
    return tree;
}

class DaemonTest : public testing::Test, public test::ClientAndServer {
protected:
    DaemonTest() { Settings(""); }

    void Settings(const std::string& more) const {
        folder_.Write("client/usr/tarq/etc/zel_daemon.conf",
                      "[daemon]\ngather_ms=\"50\"\ngather_max_ms=\"1000\"\nretry_first_ms=\"200\"\n"
                      "retry_max_ms=\"1000\"\n" +
                          more);
    }
    static PObject TaskOf(ZEL::SCHD_MODE mode = ZEL::SCHD_MODE_REALTIME) {
        PObject task;
        task = PObject::Map{{"command", "task_add"},    {"name", "t"},
                            {"server_ip", "127.0.0.1"}, {"user", "alice"},
                            {"pswd", "secret words"},   {"schedule_mode", static_cast<int>(mode)}};
        task["share_list"].asArray().emplace_back("docs");
        return task;
    }
    void AddTask(ZEL::SCHD_MODE mode = ZEL::SCHD_MODE_REALTIME) {
        ASSERT_EQ(Result(TaskOf(mode)), 0);
    }
    int Result(const PObject& request) const { return zel_.Ask(request)["result"].asInt32(); }
    PObject Task() const { return zel_.Ask("task_show", "t")["task"]; }
    /// All that has to be done is done.
    bool IsAtRest() const {
        const PObject task = Task();
        return task["status"].asInt32() == ZEL::TASK_STATUS_IDLE && !task.hasMember("retry_in") &&
               task["pending"].asUInt64() == 0;
    }
    bool IsEqual() const { return TreeOf(source_) == TreeOf(storage_ + "/docs"); }
    void AwaitEqual(const std::string& what = "", int seconds = 60) {
        EXPECT_TRUE(Await([&] { return IsAtRest() && IsEqual(); }, seconds))
            << what << ": " << Task().toString();
    }
    std::vector<PObject> Runs() const {
        PObject request = Request("task_log", "t");
        request["limit"] = 200;
        return zel_.Ask(request)["runs"].asArray();
    }
    uint64_t RsyncRuns() const {
        uint64_t sum = 0;
        for (const PObject& run : Runs()) {
            sum += run["rsync_runs"].asUInt64();
        }
        return sum;
    }
    /// To the server and all that it has started.
    void SignalServer(int number) const {
        const std::string root = "TARQ_ROOT=" + folder_.Path("server") + '\0';
        for (const auto& process : fs::directory_iterator("/proc")) {
            if (test::ReadFile(process.path() / "environ").find(root) != std::string::npos) {
                kill(std::stoi(process.path().filename()), number);
            }
        }
    }
    void StartRealtime() {
        zel_.Start();
        AddTask();
        AwaitEqual("first");
    }
    test::DaemonProcess zel_{folder_.Path("client"), folder_.Path("zel_daemon.log")};
};

TEST_F(DaemonTest, WhatChangesOnDiskIsSoonAtTheServer) {
    StartRealtime();
    const std::string outside = folder_.Path("outside");
    folder_.Write("outside/tree/deep/x", "moved in");
    folder_.Write("outside/secret/deep/passwd", "top secret");
    const auto in = [&](const std::string& name) { return source_ + "/" + name; };
    const struct {
        const char* what;
        std::function<void()> change;
    } steps[] = {
        {"create", [&] { Write("new", "n"); }},
        {"change", [&] { Write("new", "changed"); }},
        {"rename", [&] { fs::rename(in("new"), in("renamed")); }},
        {"delete", [&] { fs::remove(in("renamed")); }},
        {"a tree moved in", [&] { fs::rename(outside + "/tree", in("tree")); }},
        {"changed below", [&] { Write("tree/deep/x", "changed"); }},
        {"a tree renamed", [&] { fs::rename(in("tree"), in("sub/tree2")); }},
        {"a tree moved out", [&] { fs::rename(in("sub/tree2"), outside + "/tree"); }},
        {"a dangling link", [&] { fs::create_symlink("/nowhere", in("dangling")); }},
        {"a link to a folder outside", [&] { fs::create_symlink(outside, in("out")); }},
        {"a folder, then a link in its place",
         [&] {
             Write("middle/deep/passwd", "mine");
             AwaitEqual();
             // Told as changes of a path that leads outside by the time it is sent.
             Write("middle/deep/passwd", "mine again");
             fs::rename(in("middle"), outside + "/was");
             fs::create_symlink(outside + "/secret", in("middle"));
         }},
        {"odd names",
         [&] {
             for (const char* name : {"-n", "--delete", "*", "[a]", "?", "# c", "; ls", "a\nb",
                                      "\xff\xfe", "tab\t", " lead", "back\\slash", "- x", "$(id)",
                                      ".~tmp~", "\x01", "a/./b", "c/...", "::m"}) {
                 Write(name, name);
                 Write(std::string("odd/") + name + "/f", name);
             }
             Write(std::string(255, 'l'), "long");
         }},
        {"all gone",
         [&] {
             for (const auto& entry : fs::directory_iterator(source_)) {
                 fs::remove_all(entry.path());
             }
         }},
    };
    for (const auto& step : steps) {
        step.change();
        AwaitEqual(step.what);
        for (const auto& [name, content] : TreeOf(storage_)) {
            EXPECT_NE(content, "top secret") << name;
        }
    }
    EXPECT_EQ(Runs().front()["error"].asString(), "");
    // Changes within a second that keep the size.
    for (int i = 0; i < 12; ++i) {
        Write("counter", std::to_string(i % 10));
        AwaitEqual(std::to_string(i), 20);
    }
}

TEST_F(DaemonTest, WhatIsMovedIsNotSentAgain) {
    for (int i = 0; i < 4; ++i) {
        std::string content(1 << 20, '\0');
        std::generate(content.begin(), content.end(), [] { return static_cast<char>(rand()); });
        Write("big/deep/" + std::to_string(i), content);
        Write("other" + std::to_string(i), content);
    }
    for (int i = 0; i < 500; ++i) {
        Write("many/" + std::to_string(i % 10) + "/" + std::to_string(i), std::to_string(i));
    }
    StartRealtime();
    const auto in = [&](const std::string& name) { return source_ + "/" + name; };
    const auto exchange = [&](const std::string& one, const std::string& other) {
        EXPECT_EQ(
            renameat2(AT_FDCWD, in(one).c_str(), AT_FDCWD, in(other).c_str(), RENAME_EXCHANGE), 0);
    };
    uint64_t before = 0;
    const auto sent = [&] {
        uint64_t sum = 0;
        for (const PObject& run : Runs()) {
            sum += run["bytes_sent"].asUInt64();
        }
        return sum - std::exchange(before, sum);
    };
    sent();
    const struct {
        const char* what;
        std::function<void()> change;
    } steps[] = {
        {"a folder", [&] { fs::rename(in("big"), in("large")); }},
        // What comes before the folder is watched is told as new.
        {"a new folder", [&] { fs::create_directories(in("new/deep")); }},
        {"a file into it", [&] { fs::rename(in("other0"), in("new/deep/name \n\"%")); }},
        {"a chain, and what was in it",
         [&] {
             fs::rename(in("large"), in("x"));
             fs::rename(in("x/deep"), in("deep"));
             fs::rename(in("x"), in("sub/y"));
             fs::rename(in("deep"), in("sub/y/deeper"));
         }},
        {"two change places",
         [&] {
             fs::rename(in("other1"), in("tmp"));
             fs::rename(in("other2"), in("other1"));
             fs::rename(in("tmp"), in("other2"));
         }},
        {"two change places at once",
         [&] {
             exchange("sub/y", "other3");
             exchange("other1", "other2");
             exchange("other3", "sub/y");
             exchange("sub/y", "other2");
         }},
        {"and back", [&] { exchange("sub/y", "other2"); }},
        {"moved, and changed since",
         [&] {
             fs::rename(in("sub/y"), in("y"));
             Write("y/deeper/0", "changed");
             fs::remove(in("y/deeper/1"));
             Write("sub/y/again", "new");
         }},
    };
    for (const auto& step : steps) {
        // Heard of at once: what is moved on while it is being compared may be sent.
        zel_.Signal(SIGSTOP);
        step.change();
        zel_.Signal(SIGCONT);
        AwaitEqual(step.what);
        EXPECT_LT(sent(), 20000U) << step.what;
    }
    // What did not change in it is not even compared, nor does the brake look at it. What was
    // written right before it was sent may be taken for changed, once.
    bool is_little = false;
    for (int i = 0; i < 4 && !is_little; ++i) {
        fs::rename(in(i % 2 == 0 ? "many" : "sub/all"), in(i % 2 == 0 ? "sub/all" : "many"));
        AwaitEqual("many");
        is_little = sent() < 2000U;
    }
    EXPECT_TRUE(is_little);
    if (fs::exists(in("many"))) {
        fs::rename(in("many"), in("sub/all"));
        AwaitEqual("back");
        sent();
    }
    // Nobody could be told: it is told later, by a daemon that has been killed meanwhile.
    StopServer();
    fs::rename(in("y"), in("z"));
    ASSERT_TRUE(Await([&] { return Task()["pending"].asUInt64() > 0; }));
    zel_.End(SIGKILL);
    StartServer();
    zel_.Start();
    AwaitEqual("told later");
    EXPECT_LT(sent(), 40000U);
    // What the server cannot move is sent.
    Must(Server("disable"));
    fs::rename(in("other1"), in("sub/o"));
    Write("other1", "another");
    fs::create_directories(storage_ + "/docs/sub/o/in the way");
    fs::rename(in("sub/all"), in("all"));
    fs::create_directories(storage_ + "/docs/all/in the way");
    Must(Server("enable"));
    AwaitEqual("in the way");
}

// rsync takes one for the other.
TEST_F(DaemonTest, AFileInThePlaceOfOneOfItsSizeAndTimeIsSent) {
    const auto in = [&](const std::string& name) { return source_ + "/" + name; };
    const auto time = fs::file_time_type::clock::now();
    const auto write = [&](const std::string& name, const std::string& content) {
        Write(name, content);
        fs::last_write_time(in(name), time);
    };
    for (const char* name : {"a", "b", "c", "deep/er/a", "deep/er/b"}) {
        write(name, name + std::string(9 - strlen(name), '-'));
    }
    StartRealtime();
    fs::rename(in("a"), in("b"));
    AwaitEqual("a file");
    fs::rename(in("deep/er/a"), in("deep/er/b"));
    fs::rename(in("deep"), in("moved"));
    AwaitEqual("in a folder that is moved");
    zel_.End(SIGTERM);
    fs::rename(in("c"), in("moved/er/b"));
    zel_.Start();
    AwaitEqual("while nobody looked");
}

// Most of it happens while something is being sent.
TEST_F(DaemonTest, WhateverIsMovedAndChangedAtRandomIsEqualInTheEnd) {
    folder_.Write("client/usr/tarq/etc/zel_daemon.conf",
                  "[daemon]\ngather_ms=\"20\"\ngather_max_ms=\"50\"\n");
    zel_.Start();
    PObject task = TaskOf();
    task["brake"] = 0;
    ASSERT_EQ(Result(task), 0);
    AwaitEqual("first");
    std::minstd_rand random(12);
    const auto place = [&] {
        std::string path;
        for (auto depth = 1 + random() % 3; depth > 0; --depth) {
            path += std::string(path.empty() ? "" : "/") + static_cast<char>('a' + random() % 3);
        }
        return path;
    };
    const auto file = [&] { return place() + "/file" + std::to_string(random() % 4); };
    const auto in = [&](const std::string& name) { return source_ + "/" + name; };
    std::error_code refused;
    for (int round = 0; round < 8; ++round) {
        for (int i = 0; i < 80; ++i) {
            switch (random() % 8) {
                case 0:
                case 1:
                case 2:
                    fs::create_directories(in(place()), refused);
                    // Where there is such a folder. Some are of one size and time.
                    std::ofstream(in(file())) << random() % 10;
                    break;
                case 3:
                    fs::rename(in(file()), in(file()), refused);
                    break;
                case 4:
                    fs::remove(in(file()), refused);
                    break;
                default:
                    fs::rename(in(place()), in(place()), refused);
            }
            std::this_thread::sleep_for(milliseconds(random() % 40));
        }
        AwaitEqual("round " + std::to_string(round));
    }
}

TEST_F(DaemonTest, AFloodOfChangesCostsFewRuns) {
    StartRealtime();
    const char* const stress = getenv("ZEL_STRESS_SECONDS");
    const int files = 1000 * std::clamp(stress != nullptr ? atoi(stress) : 10, 1, 50);
    const uint64_t before = RsyncRuns();
    const auto path = [&](int i) {
        return source_ + "/flood/" + std::to_string(i % 100) + "/" + std::to_string(i);
    };
    for (int i = 0; i < 100; ++i) {
        fs::create_directories(source_ + "/flood/" + std::to_string(i));
    }
    for (int i = 0; i < files; ++i) {
        std::ofstream(path(i)) << i;
        std::ofstream(path(i), std::ios::app) << "more";
        chmod(path(i).c_str(), 0640);
        fs::rename(path(i), path(i) + "r");
        if (i % 2 == 0) {
            fs::remove(path(i) + "r");
        }
    }
    AwaitEqual("flood", 180);
    // All that has come by then goes with a run, and it begins only when the one before has ended.
    EXPECT_LE(RsyncRuns() - before, 40u);
}

TEST_F(DaemonTest, AnOverflowOfTheQueueIsMadeUpForByOneSearch) {
    for (const char* watched : {"over0/watched", "over1/watched", "elsewhere/watched"}) {
        Write(watched, "");
    }
    StartRealtime();
    const uint64_t before = RsyncRuns();
    std::ifstream queue("/proc/sys/fs/inotify/max_queued_events");
    int events = 0;
    queue >> events;
    zel_.Signal(SIGSTOP);
    for (int i = 0; i < events / 2 + 100; ++i) {  // each is made and closed
        Write("over" + std::to_string(i % 2) + "/" + std::to_string(i), "");
    }
    Write("elsewhere/lost", "");  // nothing else tells of this folder
    zel_.Signal(SIGCONT);
    AwaitEqual("overflow");
    EXPECT_THAT(zel_.Log(), HasSubstr("too many changes at once; they are looked for"));
    EXPECT_LE(RsyncRuns() - before, 12u);
}

TEST_F(DaemonTest, WhatTheKernelDoesNotWatchIsComparedNowAndThen) {
    for (int i = 0; i < 40; ++i) {
        Write("d" + std::to_string(i) + "/f", "x");
    }
    Settings("poll_seconds=\"3\"\n");
    const auto set = [](const std::string& limit, int value) {
        return "echo " + std::to_string(value) + " >/proc/sys/user/max_inotify_" + limit;
    };
    for (const std::string limit : {"watches", "instances"}) {
        try {  // a limit of its own needs a user namespace of its own
            zel_.Start({"unshare", "-Ur", "sh", "-c",
                        set(limit, limit == "watches" ? 20 : 0) + " && exec \"$@\"", "sh"});
        } catch (const std::exception& error) {
            GTEST_SKIP() << error.what();
        }
        if (limit == "watches") {
            AddTask();
        }
        AwaitEqual("first");
        EXPECT_THAT(Task()["note"].asString(), HasSubstr("raise fs.inotify.max_user_" + limit));
        for (int i = 0; i < 40; ++i) {
            Write("d" + std::to_string(i) + "/f", limit);
        }
        AwaitEqual("changed where nobody watches");
        // Once the limit is raised, all is watched without a word from anybody.
        test::Run("nsenter -U --preserve-credentials -t " + std::to_string(zel_.Pid()) +
                  " sh -c '" + set(limit, 1000) + "'");
        EXPECT_TRUE(Await([&] { return !Task().hasMember("note"); })) << Task().toString();
        EXPECT_GT(zel_.Ask("daemon_status")["folders"].asUInt64(), 40u);
        EXPECT_EQ(zel_.End(SIGTERM), 0);
    }
}

TEST_F(DaemonTest, AShareWhoseFolderIsAwayCostsNothingAndComesBack) {
    StartRealtime();
    fs::rename(source_, source_ + ".away");
    ASSERT_TRUE(Await([&] { return Task()["sync_result"].asInt32() == ZEL::TASK_RESULT_FAILED; }));
    EXPECT_THAT(Task()["note"].asString(), HasSubstr("its folder has gone"));
    EXPECT_EQ(Task()["watched_folders"].asUInt64(), 0U);
    EXPECT_EQ(Task()["watch_complete"].asInt32(), 0);
    EXPECT_THAT(Task()["watch_problem"].asString(), HasSubstr("its folder has gone"));
    std::this_thread::sleep_for(std::chrono::seconds(3));
    EXPECT_LE(Runs().size(), 10u);
    EXPECT_LE(zel_.Log().size(), 10000u) << "it goes round and round";
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    fs::rename(source_ + ".away", source_);
    Write("while/away", "x");
    AwaitEqual("back");
    Write("while/there", "x");
    AwaitEqual("watched again");
    EXPECT_EQ(Task()["note"].asString(), "");

    // What was mounted below it is away: its copy stays, the rest goes on, and the task says so.
    const std::string disk = source_ + "/disk";
    folder_.Write("a disk/file", "x");
    fs::create_directories(disk);
    if (mount(folder_.Path("a disk").c_str(), disk.c_str(), "", MS_BIND, nullptr) != 0) {
        GTEST_SKIP() << "needs root to mount a disk";
    }
    AwaitEqual("mounted");
    std::this_thread::sleep_for(std::chrono::seconds(2));  // mounts are looked at after a second
    umount2(disk.c_str(), 0);
    Write("while/unmounted", "x");
    EXPECT_TRUE(Await([&] {
        return Task()["last_error"].asString().find("/disk is not mounted") != std::string::npos &&
               fs::exists(storage_ + "/docs/while/unmounted");
    })) << Task().toString();
    EXPECT_TRUE(fs::exists(storage_ + "/docs/disk/file"));
    mount(folder_.Path("a disk").c_str(), disk.c_str(), "", MS_BIND, nullptr);
    AwaitEqual("mounted again");
    umount2(disk.c_str(), 0);
}

TEST_F(DaemonTest, AnotherFolderInThePlaceOfTheSharesDeletesNothingUntilAPersonSaysSo) {
    StartRealtime();
    const auto copy = TreeOf(storage_);
    fs::rename(source_, source_ + ".away");
    fs::create_directories(source_);
    ASSERT_TRUE(Await([&] {
        return Task()["last_error"].asString().find("zelctl share confirm docs") !=
               std::string::npos;
    }));
    EXPECT_EQ(TreeOf(storage_), copy);
    EXPECT_EQ(Client("share confirm docs").exit_code, 2) << "nobody to ask";
    EXPECT_EQ(TreeOf(storage_), copy);
    const test::Outcome confirmed = Client("share confirm docs --yes");
    EXPECT_EQ(confirmed.exit_code, 0);
    EXPECT_THAT(confirmed.output, HasSubstr("deletes the whole copy"));
    AwaitEqual("confirmed");

    // Another folder of the daemon's than the person's is no share.
    PObject check = Request("share_check");
    struct stat info = {};
    ASSERT_EQ(stat(source_.c_str(), &info), 0);
    check["path"] = source_;
    check["device"] = static_cast<unsigned long long>(info.st_dev);
    check["inode"] = static_cast<unsigned long long>(info.st_ino);
    check["volume"] = "/no/such/volume";
    EXPECT_THAT(zel_.Ask(check)["problem"].asString(), HasSubstr("/no/such/volume"));
    check["inode"] = 1;
    EXPECT_THAT(zel_.Ask(check)["problem"].asString(), HasSubstr("another folder"));
    check["path"] = source_ + "/none";
    EXPECT_THAT(zel_.Ask(check)["problem"].asString(), HasSubstr("No such file"));
}

TEST_F(DaemonTest, TheFolderThatIsPushedIsTheOneThatIsWatched) {
    StartRealtime();
    for (int i = 0; i < 4; ++i) {
        fs::rename(source_, source_ + ".aside");
        fs::rename(source_ + ".aside", source_);
    }
    AwaitEqual("renamed and back");
    Write("then", "x");
    AwaitEqual("watched again");
    ASSERT_EQ(Result(Request("task_remove", "t")), 0);

    // Another tree in the place of a folder above the share's: nothing is told of the folder
    // itself.
    const std::string above = folder_.Path("above");
    const std::string copy = storage_ + "/deep/f";
    folder_.Write("above/deep/f", "mine");
    Must(Client("share add deep " + above + "/deep"));
    PObject task = TaskOf();
    task["share_list"].asArray() = {PObject("deep")};
    ASSERT_EQ(Result(task), 0);
    ASSERT_TRUE(Await([&] { return IsAtRest() && test::ReadFile(copy) == "mine"; }));
    fs::rename(above, above + ".aside");
    folder_.Write("above/deep/f", "of another");
    EXPECT_TRUE(Await([&] {
        return Task()["last_error"].asString().find("zelctl share confirm deep") !=
               std::string::npos;
    })) << Task().toString();
    EXPECT_EQ(test::ReadFile(copy), "mine");
    Must(Client("share confirm deep --yes"));
    EXPECT_TRUE(Await([&] { return test::ReadFile(copy) == "of another"; }));
    EXPECT_TRUE(Await([&] { return IsAtRest(); }));
    folder_.Write("above/deep/f", "of another, changed");
    EXPECT_TRUE(Await([&] { return test::ReadFile(copy) == "of another, changed"; }));
    folder_.Write("above.aside/deep/f", "the old one");
    std::this_thread::sleep_for(std::chrono::seconds(1));
    EXPECT_TRUE(IsAtRest());
    EXPECT_EQ(test::ReadFile(copy), "of another, changed");
}

TEST_F(DaemonTest, ARestoreTakesTheTasksPasswordAndPausesWhatPushesItsFolder) {
    StartRealtime();
    const std::string elsewhere = folder_.Path("elsewhere");
    EXPECT_THAT(Client("restore t --to " + elsewhere), test::Ended(0, "3 files restored"));
    EXPECT_EQ(TreeOf(elsewhere), TreeOf(source_));
    EXPECT_THAT(Client("restore t --share other --to " + elsewhere), test::Ended(2, "no share"));
    EXPECT_EQ(Task()["status"].asInt32(), ZEL::TASK_STATUS_IDLE);
    // A folder above the share's is pushed from in part.
    EXPECT_THAT(Client("restore t --dry-run --to " + folder_.Path("")), test::Ended(0));
    EXPECT_EQ(Task()["status"].asInt32(), ZEL::TASK_STATUS_IDLE);
    EXPECT_THAT(Client("restore t --to " + source_ + "/sub/../back"),
                test::Ended(0, "Task 't' pushes this folder and is paused now"));
    EXPECT_EQ(Task()["status"].asInt32(), ZEL::TASK_STATUS_PAUSED);
    EXPECT_EQ(TreeOf(source_ + "/back").size(), 4U);
    EXPECT_EQ(TreeOf(storage_ + "/docs").size(), 4U);
    EXPECT_THAT(Client("task resume t"), test::Ended(0));
    AwaitEqual("resumed");
}

TEST_F(DaemonTest, ALostCopyIsWholeAfterTheNextChangeAndOneThatWentOnWaits) {
    StartRealtime();
    const std::string copy = storage_ + "/docs";
    fs::create_directories(folder_.Path("clone"));
    fs::copy(folder_.Path("client/usr"), folder_.Path("clone/usr"), fs::copy_options::recursive);
    fs::remove_all(copy);
    Write("one", "small change");
    AwaitEqual("the folder was gone");
    fs::rename(copy, folder_.Path("disk"));
    fs::create_directory(copy);
    fs::permissions(copy, fs::perms::owner_all);
    Write("two", "small change");
    AwaitEqual("another folder was there");
    EXPECT_THAT(test::ReadFile(folder_.Path("client/usr/tarq/etc/zel_shares/docs")),
                Not(HasSubstr("begun")));

    // What a clone leaves behind is no base for small changes.
    Must(test::Zelctl(folder_.Path("clone"),
                      "push docs -s 127.0.0.1 -u alice --password-file - --exclude one",
                      "secret words\n"));
    Write("three", "small change");
    EXPECT_TRUE(Await([&] {
        return Task()["last_error"].asString().find("changed by another machine") !=
               std::string::npos;
    })) << Task().toString();
    EXPECT_FALSE(fs::exists(copy + "/three"));
    Must(Client("share confirm docs --yes"));
    AwaitEqual("a person has said so");
}

TEST_F(DaemonTest, WhatDiffersAtTheServerIsFoundByContentAndSentUnlessItIsDamage) {
    StartRealtime();
    EXPECT_THAT(Client("verify t"), test::Ended(0, "docs: the same at both ends"));

    const fs::path copy = storage_ + "/docs";
    const auto changed = fs::last_write_time(copy / "a.txt");
    std::string content = test::ReadFile(copy / "a.txt");
    content[0] ^= 1;
    std::ofstream(copy / "a.txt") << content;
    fs::last_write_time(copy / "a.txt", changed);
    fs::remove(copy / "sub/b.txt");
    std::ofstream(copy / "stray") << "nobody's";
    const test::Outcome found = Client("verify t");
    EXPECT_EQ(found.exit_code, 1);
    EXPECT_THAT(found.output, AllOf(HasSubstr("DAMAGED  a.txt ("), HasSubstr("differs  sub/b.txt"),
                                    HasSubstr("extra    stray\n"), HasSubstr("1 file with other")));
    // Only of damage nobody knows which side is right.
    EXPECT_TRUE(Await([&] {
        return IsAtRest() && fs::exists(copy / "sub/b.txt") && !fs::exists(copy / "stray");
    })) << Task().toString();
    EXPECT_EQ(test::ReadFile(copy / "a.txt"), content);
    EXPECT_THAT(Client("verify t --share docs sub/"), test::Ended(0, "the same"));
    EXPECT_THAT(Client("verify t sub a.txt"), test::Ended(1, "DAMAGED  a.txt"));
    EXPECT_THAT(Client("verify t ../docs"), test::Ended(2, "no path of a share"));
    EXPECT_THAT(Client("verify t --share none"), test::Ended(2, "no share 'none'"));
}

// A byte of the copy is another one, under the same size and time.
void Rot(const fs::path& file) {
    const auto changed = fs::last_write_time(file);
    std::string content = test::ReadFile(file);
    content[0] ^= 1;
    std::ofstream(file) << content;
    fs::last_write_time(file, changed);
}

TEST_F(DaemonTest, WhatRotsAndWhatIsMissingIsFoundBySlicesThatGoOnAfterARestart) {
    const std::string slow = "verify_gap_ms=\"3600000\"\nverify_files=\"1\"\n";
    Settings("verify_gap_ms=\"10\"\nverify_files=\"1\"\n");
    for (const char* name : {"b", "c/d", "c/e", "# f", "y", "z"}) {
        Write(name, "content");
    }
    StartRealtime();
    ASSERT_TRUE(Await([&] { return Task()["verify_place"].isString(); })) << Task().toString();
    Settings(slow);
    Must(Client("reload"));
    ASSERT_TRUE(Await([&] { return IsAtRest(); }));
    const std::string place = Task()["verify_place"].asString();
    ASSERT_NE(place, "") << "the round has ended already";
    EXPECT_EQ(zel_.End(SIGTERM), 0);
    {
        // A round takes its time; on a disk with few files each of these would be a day's work.
        zel_daemon::Database store(folder_.Path("client/usr/tarq/etc/zel_daemon/tasks.db"));
        store.Execute("UPDATE verified SET begun = begun - 29 * 86400");
    }
    zel_.Start();
    AwaitEqual("started again");
    EXPECT_GE(Task()["verify_place"].asString(), place);

    const fs::path copy = storage_ + "/docs";
    Rot(copy / "# f");  // has been read in this round
    Rot(copy / "z");
    fs::remove(copy / "y");
    Settings("verify_gap_ms=\"10\"\n");
    Must(Client("reload"));
    ASSERT_TRUE(Await([&] { return Task()["last_verified"].isInteger(); })) << Task().toString();
    EXPECT_TRUE(Await([&] { return IsAtRest() && fs::exists(copy / "y"); }));
    EXPECT_EQ(Task()["damaged"].asUInt64(), 1U) << Task().toString();
    EXPECT_THAT(Client("task show t"), test::Ended(0, "docs: z (7 B)"));
    EXPECT_THAT(Client("status"), test::Ended(0, "1 file with other bytes"));
    EXPECT_THAT(Client("doctor"), test::Ended(3, "1 file with other bytes at the two ends"));
    EXPECT_THAT(test::ReadFile(folder_.Path("zel_daemon.log")), HasSubstr("DAMAGED z in share"));
    EXPECT_THAT(Client("verify t"), test::Ended(1, "DAMAGED  # f"));
    EXPECT_EQ(Task()["damaged"].asUInt64(), 2U);

    // What a push replaces is settled, and what a person finds well.
    Write("z", "written anew");
    Rot(copy / "# f");
    EXPECT_TRUE(Await([&] { return IsAtRest() && Task()["damaged"].asUInt64() == 1; }));
    EXPECT_THAT(Client("verify t '# f'"), test::Ended(0));
    EXPECT_FALSE(Task().hasMember("damaged"));

    // A file of a folder that stays behind is not sent with its change either.
    Must(Client("task edit t --exclude cache/ --verify off"));
    AwaitEqual("edited");
    Write("cache/deep/x", "stays");
    Write("after", "goes");
    EXPECT_TRUE(Await([&] { return IsAtRest() && fs::exists(copy / "after"); }));
    EXPECT_FALSE(fs::exists(copy / "cache/deep/x"));
}

TEST_F(DaemonTest, AnOutageLosesNothingAndMakesNoHotLoop) {
    StartRealtime();
    StopServer();
    const size_t runs = Runs().size();
    const auto begin = steady_clock::now();
    Write("during/outage", "x");
    fs::remove(source_ + "/a.txt");
    ASSERT_TRUE(Await([&] { return Runs().size() >= runs + 5; }));
    EXPECT_THAT(Task()["last_error"].asString(), HasSubstr("refuses"));
    EXPECT_GT(Task()["pending"].asUInt64(), 0u);
    const double seconds = std::chrono::duration<double>(steady_clock::now() - begin).count();
    // 0.2 s, 0.4 s, 0.8 s, then 1 s, each a fifth shorter at most.
    EXPECT_GE(seconds, 0.8 * (0.2 + 0.4 + 0.8 + 1.0));
    Write("during/later", "y");
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    StartServer();
    AwaitEqual("after the outage");
    EXPECT_EQ(Task()["last_error"].asString(), "");
}

TEST_F(DaemonTest, AFullDiskAtTheServerIsSaidAndItsChangesAreSentLater) {
    if (!PutStorageOnDisk("4m")) {
        GTEST_SKIP() << "needs root to mount a small disk";
    }
    StartRealtime();
    Write("large", std::string(8 << 20, 'x'));
    EXPECT_TRUE(Await([&] {
        return Task()["last_error"].asString().find("full") != std::string::npos;
    })) << Task().toString();
    EXPECT_GT(Task()["pending"].asUInt64(), 0u);
    EXPECT_TRUE(PutStorageOnDisk("32m"));
    AwaitEqual("healed");
}

/// Changes a tree for as long as it lives.
class Writer {
public:
    explicit Writer(std::string folder) : folder_(std::move(folder)), thread_([this] { Run(); }) {}
    ~Writer() {
        stop_ = true;
        thread_.join();
    }

private:
    std::string Path() {
        return folder_ + "/" + std::to_string(random_() % 5) + "/" + std::to_string(random_() % 5);
    }
    void Run() {
        std::error_code ignored;
        while (!stop_) {
            const std::string path = Path();
            const unsigned long what = random_() % 5;
            if (what == 0) {
                fs::remove_all(path, ignored);
            } else if (what == 1) {
                renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, Path().c_str(),
                          random_() % 2 == 0 ? RENAME_EXCHANGE : 0);
            } else {
                fs::create_directories(fs::path(path).parent_path(), ignored);
                std::ofstream(path) << random_();
            }
            std::this_thread::sleep_for(milliseconds(2));
        }
    }

    const std::string folder_;
    std::minstd_rand random_{7};
    std::atomic<bool> stop_{false};
    std::thread thread_;
};

TEST_F(DaemonTest, AHundredKillsLoseNothing) {
    // A run begins soon after a start, though something changes all the time.
    folder_.Write("client/usr/tarq/etc/zel_daemon.conf",
                  "[daemon]\ngather_ms=\"20\"\ngather_max_ms=\"50\"\nretry_first_ms=\"100\"\n"
                  "retry_max_ms=\"200\"\n");
    StartRealtime();
    std::minstd_rand random(11);
    uint64_t in_a_run = 0;
    {
        const Writer writer(source_ + "/busy");
        for (int i = 0; i < 100; ++i) {
            std::this_thread::sleep_for(milliseconds(random() % 400));
            zel_.End(SIGKILL);
            {
                zel_daemon::Database store(folder_.Path("client/usr/tarq/etc/zel_daemon/tasks.db"));
                zel_daemon::Query check(store, "PRAGMA integrity_check");
                ASSERT_TRUE(check.Next());
                ASSERT_EQ(check.Text(), "ok") << "after " << i;
                in_a_run += store.Number("SELECT count(*) FROM runs WHERE end_time = 0") > 0;
            }
            zel_.Start();
        }
    }
    AwaitEqual("after the kills");
    EXPECT_GE(in_a_run, 20u);
    // What comes after needs no whole comparison: the watch stands.
    Write("after", "x");
    AwaitEqual("after");
}

TEST_F(DaemonTest, AfterARestartOnlyWhatHasChangedTravels) {
    for (const char* name : {"gone/deep/x", "renamed/x", "file to folder", "folder to file/x",
                             "kept/sub/x", "linked", "late", "only/folders/below/x"}) {
        Write(name, name);
    }
    const auto in = [&](const std::string& name) { return source_ + "/" + name; };
    fs::create_hard_link(in("linked"), in("kept/other name"));
    std::this_thread::sleep_for(milliseconds(200));  // what is younger is looked at again
    StartRealtime();
    uint64_t compared = Task()["last_compared"].asUInt64();
    const auto again = [&](const char* what, std::optional<bool> whole, int signal = SIGTERM) {
        zel_.End(signal);
        zel_.Start();
        EXPECT_TRUE(Await([&] { return Task()["watch_searching"].asInt32() == 0; })) << what;
        AwaitEqual(what);
        const uint64_t now = Task()["last_compared"].asUInt64();
        EXPECT_EQ(now != compared, whole.value_or(now != compared)) << what;
        compared = now;
        std::this_thread::sleep_for(milliseconds(1100));  // for another time of comparing
    };
    size_t runs = Runs().size();
    again("nothing has changed", false);
    EXPECT_EQ(Runs().size(), runs) << "nobody has asked the server";
    Write("late", "sent by a run of its own");
    AwaitEqual();
    std::this_thread::sleep_for(milliseconds(1500));
    runs = Runs().size();
    again("nor after a change", false, SIGKILL);
    EXPECT_EQ(Runs().size(), runs);

    zel_.End(SIGTERM);
    fs::remove_all(in("gone"));
    fs::rename(in("renamed"), in("kept/moved"));
    fs::remove(in("file to folder"));
    Write("file to folder/x", "x");
    fs::remove_all(in("folder to file"));
    Write("folder to file", "x");
    Write("new/tree/of/files", "x");
    Write("kept/other name", "through one of its names");
    Write("kept/sub/temporary", "");
    fs::remove(in("kept/sub/temporary"));
    Write("temporary", "");
    fs::remove(in("temporary"));
    zel_.Start();
    EXPECT_TRUE(Await([&] { return Task()["watch_searching"].asInt32() == 0; }));
    AwaitEqual("changed meanwhile");
    for (const char* folder : {"", "/kept", "/kept/sub", "/new/tree"}) {
        EXPECT_EQ(fs::last_write_time(source_ + folder),
                  fs::last_write_time(storage_ + "/docs" + folder))
            << folder;
    }
    EXPECT_EQ(Task()["last_compared"].asUInt64(), compared);
    std::this_thread::sleep_for(milliseconds(1500));
    again("and nothing again", false);

    // What is written through one name of a file is soon at the server under the others.
    Write("linked", "through the other");
    AwaitEqual("linked");
    // Whoever pushes beside the daemon knows more than the index does.
    zel_.End(SIGTERM);
    Must(Client("push docs --server 127.0.0.1 --user alice --password-file -", "secret words\n"));
    again("pushed by hand", true);
    // A run that is cut off, perhaps before it has begun to send, says nothing of what came of it.
    Write("late", std::string(20 << 20, 'x'));
    ASSERT_TRUE(Await([&] { return Task()["status"].asInt32() == ZEL::TASK_STATUS_RUNNING; }));
    again("cut off", std::nullopt, SIGKILL);
    // Nor does an index that is damaged.
    const std::string index = folder_.Path("client/usr/tarq/etc/zel_daemon/index/1/docs.index");
    std::fstream(index) << std::string(20000, 'x');
    again("damaged", true);
    fs::remove(index);
    again("lost", true);
    again("whole again", false);
}

TEST_F(DaemonTest, AShareOfAnotherClientIsToldAndNothingChanges) {
    StartRealtime();
    const std::string registry = Server("shares --json").output;
    const auto copy = TreeOf(storage_);
    const auto start_as = [&](const std::string& client) {
        zel_.End(SIGTERM);
        folder_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"" + client + "\"\n");
        Write("new", client);
        zel_.Start();
    };
    start_as("CLIENT-2");
    EXPECT_TRUE(Await([&] { return !Task()["last_error"].asString().empty(); }));
    EXPECT_THAT(Task()["last_error"].asString(), HasSubstr("the share is another client's"));
    EXPECT_EQ(Server("shares --json").output, registry);
    EXPECT_EQ(TreeOf(storage_), copy);
    start_as("CLIENT-1");
    AwaitEqual("the first client goes on");
}

TEST_F(DaemonTest, ABadRequestIsRefusedInWordsAndChangesNothing) {
    zel_.Start();
    AddTask(ZEL::SCHD_MODE_MANUAL);
    PObject list = Request("task_list");
    list["secrets"] = 1;
    const std::string before = zel_.Ask(list).toString();
    PObject add = TaskOf(ZEL::SCHD_MODE_MANUAL);
    add["name"] = "u";
    PObject unknown;
    PObject numbers;
    PObject many;
    unknown.asArray().emplace_back("no such share");
    numbers.asArray().emplace_back(1);
    many.asArray().resize(10000, std::string(50, 'x'));
    const struct {
        PObject request;
        const char* key;  // that gets each of the values
        std::vector<PObject> values;
    } cases[] = {
        {PObject(), "command", {"no such", "task_show", "", 5, unknown}},
        {Request("task_show"), "task", {"none", 7, unknown}},
        {Request("task_run"), "task", {"none"}},
        {Request("task_cancel"), "task", {"t", "none"}},
        {Request("watch"), "task", {"none"}},
        {Request("task_list"), "brief", {"yes", 2}},
        {Request("task_list"), "colour", {1}},
        {Request("share_check"), "path", {5}},
        {Request("task_log", "t"), "limit", {-1, 100000, "x"}},
        {add, "share_list", {"docs", numbers, unknown, many, PObject()}},
        {add, "name", {"t", "a\nb", "", std::string(60000, 'n'), 5}},
        {add, "schedule_mode", {"x", 99}},
        {add, "rsync_timeout", {5}},
        {add, "ssh_port", {1 << 20}},
        {add, "user", {""}},
        {add, "paused", {2, "yes"}},
        {add, "", {1}},
        {Request("task_edit", "t"), "id", {9}},
        {Request("task_edit", "t"), "name", {""}},
        {Request("task_edit", "t"), "share_list", {PObject(), unknown}},
    };
    std::vector<PObject> requests = {"text", 7, PObject(), unknown};  // no maps
    for (const auto& test_case : cases) {
        for (const PObject& value : test_case.values) {
            requests.push_back(test_case.request);
            requests.back()[test_case.key] = value;
        }
    }
    for (const PObject& request : requests) {
        const PObject reply = zel_.Ask(request);
        EXPECT_LT(reply["result"].asInt32(), 0) << request.toString().substr(0, 200);
        EXPECT_FALSE(reply["error"].asString().empty()) << request.toString().substr(0, 200);
    }
    EXPECT_EQ(zel_.Ask(list).toString(), before);
}

/// A raw connection to the daemon's socket.
class RawPeer {
public:
    explicit RawPeer(const std::string& path)
        : fd_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
        sockaddr_un address = {};
        address.sun_family = AF_UNIX;
        path.copy(address.sun_path, sizeof address.sun_path - 1);
        const timeval limit = {30, 0};
        setsockopt(fd_, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
        connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address);
    }
    ~RawPeer() { close(fd_); }

    /// False when the other side takes no more.
    bool Send(const std::string& bytes) const {
        return send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL) ==
               static_cast<ssize_t>(bytes.size());
    }
    /// All until the other side closes.
    std::string ReadAll() const {
        std::string all;
        char bytes[4096];
        for (ssize_t got; (got = recv(fd_, bytes, sizeof bytes, 0)) > 0;) {
            all.append(bytes, static_cast<size_t>(got));
        }
        return all;
    }

private:
    int fd_;
};

/// In pages.
size_t Resident(pid_t pid) {
    std::ifstream memory("/proc/" + std::to_string(pid) + "/statm");
    size_t pages = 0;
    memory >> pages >> pages;
    return pages;
}

TEST_F(DaemonTest, HostilePeersHoldUpNobody) {
    zel_.Start();
    AddTask(ZEL::SCHD_MODE_MANUAL);
    const auto expect_alive = [&](const std::string& what) {
        const auto begin = steady_clock::now();
        EXPECT_EQ(zel_.Ask("task_list")["tasks"].asArray().size(), 1u) << what;
        EXPECT_LT(steady_clock::now() - begin, std::chrono::seconds(2)) << what;
    };
    for (const std::string& bytes :
         {std::string("GET / HTTP/1.0\r\n\r\n"), std::string(100000, 'A'), std::string(64, '\xff'),
          std::string("B\x01\x01\x01"), std::string("@")}) {
        const RawPeer peer(zel_.Socket());
        peer.Send(bytes);
        EXPECT_THAT(peer.ReadAll(), HasSubstr("is no value")) << bytes.substr(0, 20);
        expect_alive(bytes.substr(0, 20));
    }
    const size_t resident = Resident(zel_.Pid());
    {
        const RawPeer endless(zel_.Socket());
        ASSERT_TRUE(endless.Send("A"));
        const std::string piece = "\x10\xff\xff" + std::string(65535, 'x');
        for (int i = 0; i < 1000 && endless.Send(piece); ++i) {
        }
        EXPECT_FALSE(endless.Send(piece));
        expect_alive("endless");
    }
    EXPECT_LT(Resident(zel_.Pid()), resident + 10000);

    // Half a request, and none at all, from more peers than are served at a time.
    std::vector<std::unique_ptr<RawPeer>> silent;
    for (int i = 0; i < 200; ++i) {
        silent.push_back(std::make_unique<RawPeer>(zel_.Socket()));
        silent.back()->Send(i % 2 == 0 ? "" : "B");
    }
    expect_alive("many");
    silent.clear();

    // Watchers that do not read: more is changed than their sockets take.
    ZEL::IPCSender deaf[20];
    for (ZEL::IPCSender& watcher : deaf) {
        watcher.connect(zel_.Socket());
        watcher.send(Request("watch"));
    }
    PObject edit = Request("task_edit", "t");
    for (int i = 0; i < 20; ++i) {
        edit["exclude"].asArray().emplace_back(std::string(60000, static_cast<char>('a' + i)));
        if (i < 15) {
            EXPECT_EQ(Result(edit), 0);
            expect_alive("deaf watchers");
        }
    }
    EXPECT_EQ(zel_.End(SIGTERM), 0);
}

TEST_F(DaemonTest, WithFewDescriptorsItStaysAndSaysWhichLimitToRaise) {
    Settings("poll_seconds=\"1\"\n");
    for (const char* few : {"32", "44"}) {  // too few for a run; for all connections
        zel_.Start({"prlimit", std::string("--nofile=") + few + ":1000"});
        if (few == std::string("32")) {
            AddTask();
        }
        std::vector<std::unique_ptr<RawPeer>> silent;
        for (int i = 0; i < 60; ++i) {
            silent.push_back(std::make_unique<RawPeer>(zel_.Socket()));
        }
        EXPECT_TRUE(Await([&] {  // a run may have what descriptors there are
            try {
                return zel_.Ask("task_list")["tasks"].asArray().size() == 1;
            } catch (const std::exception&) {
                return false;
            }
        }));
        EXPECT_THAT(zel_.Log(), HasSubstr("LimitNOFILE="));
        EXPECT_THAT(zel_.Log(), Not(HasSubstr("not mounted")));
        EXPECT_LE(zel_.Log().size(), 20000u);
        // Raised, as a unit's would be by the next start.
        test::Run("prlimit --nofile=1000 --pid " + std::to_string(zel_.Pid()));
        silent.clear();
        AwaitEqual(few);
        EXPECT_TRUE(Await([&] { return !Task().hasMember("note"); })) << Task().toString();
        EXPECT_EQ(zel_.End(SIGTERM), 0);
        Write("more", few);
    }
}

/// The bytes of a request about the task "t".
std::string Wire(const std::string& command) {
    const auto text = [](const std::string& bytes) {
        return std::string{0x10, 0, static_cast<char>(bytes.size())} + bytes;
    };
    return "B" + text("command") + text(command) + text("task") + text("t") + "@";
}

constexpr uid_t kNobody = 65534;
constexpr gid_t kUsers = 100;  // "users", on each machine

/// Whether `check` holds for somebody who is nobody else, with or without the daemon's group.
bool AsUser(bool member, const std::function<bool()>& check) {
    const pid_t child = fork();
    if (child == 0) {
        const bool dropped =
            setgroups(member ? 1 : 0, &kUsers) == 0 && setgid(kNobody) == 0 && setuid(kNobody) == 0;
        alarm(120);
        const auto held = [&]() noexcept { return dropped && check(); };
        _exit(held() ? 0 : 1);
    }
    int status = -1;
    waitpid(child, &status, 0);
    return status == 0;
}

/// The daemon with a group, for whose members its folders are open.
class DaemonGroupTest : public DaemonTest {
protected:
    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "needs root to become another user";
        }
        Settings("group=\"users\"\n");
        zel_.Start();
        AddTask(ZEL::SCHD_MODE_MANUAL);
        chmod(folder_.Path().c_str(), 0711);
    }
    std::string Stored() const {
        PObject list = Request("task_list");
        list["secrets"] = 1;
        return zel_.Ask(list).toString();
    }
    bool IsRefused(const PObject& request, const std::string& why) const {
        const PObject reply = zel_.Ask(request);
        return reply["result"].asInt32() == ZEL::RESULT_NO_PERMISSION &&
               reply["error"].asString().find(why) != std::string::npos;
    }
    test::Outcome ZelctlAs(const std::string& who, const std::string& arguments) const {
        return test::RunProgram(
            folder_.Path("client"),
            {"sh", "-c",
             "exec setpriv --reuid=65534 --regid=65534 " + who + " " ZELCTL " " + arguments});
    }
};

TEST_F(DaemonGroupTest, MembersLookAndRunAndOnlyOwnersChange) {
    const std::string before = Stored();
    PObject elsewhere = Request("task_edit", "t");
    elsewhere["server_ip"] = "127.0.0.2";
    PObject secrets = Request("task_show", "t");
    secrets["secrets"] = 1;
    PObject exported = Request("task_list");
    exported["export"] = 1;
    EXPECT_TRUE(AsUser(true, [&] {
        return IsRefused(TaskOf(), "may add tasks; members of its group may look") &&
               IsRefused(elsewhere, "may edit tasks") &&
               IsRefused(Request("task_remove", "t"), "may remove tasks") &&
               IsRefused(secrets, "may see passwords") && IsRefused(exported, "may export") &&
               IsRefused(Request("reload"), "may have the configuration");
    }));
    EXPECT_EQ(Stored(), before);
    EXPECT_TRUE(AsUser(true, [&] {
        for (const char* command : {"task_show", "task_log", "watch", "task_pause", "task_resume",
                                    "task_run", "task_cancel"}) {
            if (Result(Request(command, "t")) != 0) {
                return false;
            }
        }
        return Result(Request("task_list")) == 0 && Result(Request("daemon_status")) == 0;
    }));
    EXPECT_TRUE(AsUser(false, [&] {
        ZEL::IPCSender sender;
        return sender.connect(zel_.Socket()) != 0;
    }));
    chmod(zel_.Socket().c_str(), 0777);  // whatever lets him get there
    EXPECT_TRUE(AsUser(false, [&] { return IsRefused(Request("task_show", "t"), "only root"); }));
    ASSERT_TRUE(Await([&] { return IsAtRest(); }));
    EXPECT_THAT(ZelctlAs("--groups=100", "task run --wait t"), test::Ended(0, "t: done"));
    EXPECT_TRUE(IsEqual());

    // The preview is made by the daemon, with the password that no member sees.
    EXPECT_THAT(Client("task edit t --exclude '*.tmp'"), test::Ended(0));
    Write("left.tmp", "12345");
    Write("new\x9b", "12345");
    fs::remove(source_ + "/a.txt");
    const test::Outcome shown = ZelctlAs("--groups=100", "task run --dry-run t");
    EXPECT_THAT(shown, test::Ended(0, "send    new\\233 (5 B)\n"));
    EXPECT_THAT(shown.output, HasSubstr("delete  a.txt\ndocs: 1 file (5 B) would be sent, 1 del"));
    EXPECT_THAT(ZelctlAs("--groups=100", "task edit t --no-ssh"), test::Ended(3, "only root"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    StopServer();
    EXPECT_THAT(ZelctlAs("--groups=100", "task run --dry-run t"), test::Ended(1, "refuses"));
}

TEST_F(DaemonGroupTest, NobodyKeepsOthersFromTheDaemon) {
    ZEL::IPCSender watchers[100];
    const auto watch_all = [&] {
        size_t told = 0;
        size_t served = 0;
        for (ZEL::IPCSender& watcher : watchers) {
            PObject reply;
            if (watcher.connect(zel_.Socket()) != 0 ||
                watcher.send(Request("watch"), true, reply) != 0) {
                return size_t{0};
            }
            served += reply["result"].asInt32() == 0;
            told += reply["result"].asInt32() == ZEL::RESULT_QUOTA &&
                    reply["error"].asString().find("user ") != std::string::npos;
        }
        return told + served == 100 ? served : size_t{0};
    };
    int held[2];
    ASSERT_EQ(pipe(held), 0);
    const pid_t child = fork();
    if (child == 0) {
        setpgid(0, 0);
        EXPECT_TRUE(AsUser(true, [&] {
            const bool some = watch_all() == 16;
            return write(held[1], some ? "y" : "n", 1) == 1 && pause() == 0;
        }));
        _exit(0);
    }
    char byte = 0;
    EXPECT_EQ(read(held[0], &byte, 1), 1);
    EXPECT_EQ(byte, 'y');
    EXPECT_EQ(watch_all(), 24U);
    EXPECT_EQ(Result(Request("task_list")), 0) << "behind all of them";
    EXPECT_EQ(Result(Request("task_pause", "t")), 0);
    kill(-child, SIGKILL);  // and the user
    waitpid(child, nullptr, 0);
}

TEST_F(DaemonGroupTest, CommandsThatAreCutMixedOrSentAgainChangeNothing) {
    const std::string before = Stored();
    const std::string remove = Wire("task_remove");
    const RawPeer halves[2] = {RawPeer(zel_.Socket()), RawPeer(zel_.Socket())};
    for (size_t cut = 1; cut < remove.size(); ++cut) {
        RawPeer(zel_.Socket()).Send(remove.substr(0, cut));
        RawPeer(zel_.Socket()).Send(remove.substr(cut));
        std::string changed = remove;
        changed[cut] = static_cast<char>(changed[cut] ^ (1 << cut % 8));
        RawPeer(zel_.Socket()).Send(changed);
        halves[cut % 2].Send(remove.substr(cut, 1));
    }
    EXPECT_TRUE(AsUser(true, [&] {
        const RawPeer peer(zel_.Socket());
        return peer.Send(remove + remove + remove) && IsRefused(Request("task_remove", "t"), "");
    }));
    EXPECT_EQ(Stored(), before);
    PObject request = Request("task_edit", "t");
    for (const size_t size : {size_t{65535}, size_t{65536}, size_t{1} << 20}) {
        request["exclude"].asArray() = {std::string(size, 'x')};
        ZEL::IPCSender sender;
        PObject reply;
        ASSERT_EQ(sender.connect(zel_.Socket()), 0);
        sender.send(request, true, reply);
        EXPECT_EQ(Stored() == before, size != 65535) << size;
        EXPECT_EQ(Result(Request("task_show", "t")), 0);
        request["exclude"].asArray().clear();
        EXPECT_EQ(Result(request), 0);
    }
}

TEST_F(DaemonTest, APasswordIsForgottenWhereItWasNotGivenFor) {
    zel_.Start();
    const auto password = [&] {
        PObject request = Request("task_show", "t");
        request["secrets"] = 1;
        return zel_.Ask(request)["task"]["pswd"].asString();
    };
    AddTask(ZEL::SCHD_MODE_MANUAL);
    EXPECT_THAT(Client("task edit t --bwlimit 5 --exclude x"), test::Ended(0));
    EXPECT_EQ(password(), "secret words");
    for (const char* key : {"ssh", "ssh_port", "server_name"}) {
        PObject edit = Request("task_edit", "t");
        edit[key] = std::string(key) == "server_name" ? PObject("nas") : PObject(1);
        EXPECT_EQ(zel_.Ask(edit)["password_forgotten"].asInt32(), 1) << key;
        EXPECT_EQ(password(), "") << key;
        edit["pswd"] = "secret words";
        EXPECT_EQ(Result(edit), 0);
        EXPECT_EQ(password(), "secret words");
    }
    EXPECT_THAT(Client("task edit t --user bob"), test::Ended(0, "--password' gives it one"));
    EXPECT_EQ(password(), "");
    const test::Outcome given =
        Client("task edit t --user alice --password-file - --no-check", "other\n");
    EXPECT_EQ(given.exit_code, 0);
    EXPECT_THAT(given.output, Not(HasSubstr("forgotten")));
    EXPECT_EQ(password(), "other");
}

TEST_F(DaemonTest, AServerThatTricklesHoldsUpItsOwnTasksAlone) {
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\nanswer_seconds=\"600\"\n");
    const test::TricklingServer trickling(port_, "127.0.0.2");
    const test::TricklingServer another(port_, "127.0.0.3");
    zel_.Start();
    for (const std::string name : {"one", "two", "three", "alone"}) {
        PObject task = TaskOf(ZEL::SCHD_MODE_MANUAL);
        task["name"] = name;
        task["server_ip"] = name == "alone" ? "127.0.0.3" : "127.0.0.2";
        const std::string share = "share of " + name;
        folder_.Write("shares/" + share + "/f", "x");
        Must(Client("share add '" + share + "' '" + folder_.Path("shares/" + share) + "'"));
        task["share_list"].asArray() = {share};
        ASSERT_EQ(Result(task), 0);
        zel_.Ask("task_run", name);
    }
    ASSERT_TRUE(Await([&] { return trickling.Clients() >= 2 && another.Clients() >= 1; }));
    AddTask();
    AwaitEqual("beside servers that trickle", 20);
    EXPECT_EQ(zel_.Ask("daemon_status")["running"].asInt32(), 3);

    // Nor does somebody who asks for a preview and does not read it.
    for (int i = 0; i < 5000; ++i) {
        Write("many/" + std::string(200, 'n') + std::to_string(i), "");
    }
    zel_.Ask("task_pause", "t");
    [[maybe_unused]] const size_t resident = Resident(zel_.Pid());
    {
        const RawPeer deaf(zel_.Socket());
        deaf.Send(Wire("task_preview"));
        EXPECT_TRUE(Await([&] { return zel_.Ask("daemon_status")["running"].asInt32() == 4; }));
    }
    EXPECT_TRUE(Await([&] { return zel_.Ask("daemon_status")["running"].asInt32() == 3; }, 20));
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)  // which keep what is freed
    EXPECT_LT(Resident(zel_.Pid()), resident + 2000);
#endif
}

TEST_F(DaemonTest, WhatAnOlderVersionStoredAtAnyLengthIsTold) {
    zel_.Start();
    AddTask(ZEL::SCHD_MODE_MANUAL);
    zel_.Ask("task_run", "t");
    AwaitEqual("run");
    zel_.End(SIGTERM);
    std::string complaint;
    for (int i = 0; i < 40000; ++i) {
        complaint += "\xc3\xa4";
    }
    {
        zel_daemon::Database store(folder_.Path("client/usr/tarq/etc/zel_daemon/tasks.db"));
        zel_daemon::Query(store, "UPDATE runs SET result = 2, error = ?, details = ?", complaint,
                          complaint)
            .Run();
    }
    zel_.Start();
    const std::string told = Task()["last_error"].asString();
    EXPECT_THAT(told, EndsWith("\xa4 [...]"));
    EXPECT_GT(told.size(), 60000U);
    PObject log = Request("task_log", "t");
    log["details"] = 1;
    EXPECT_EQ(zel_.Ask(log)["runs"].asArray()[0]["details"].asString(), told);
    EXPECT_THAT(Client("task list"), test::Ended(0, "  ! \xc3\xa4"));
}

TEST_F(DaemonTest, AStopIsQuickAndTheNextStartCompletes) {
    PObject task = TaskOf(ZEL::SCHD_MODE_MANUAL);
    task["max_bandwidth"] = 512;
    Write("large", std::string(4 << 20, 'x'));
    zel_.Start();
    ASSERT_EQ(Result(task), 0);
    for (const bool stalled : {false, true}) {
        zel_.Ask("task_run", "t");
        ASSERT_TRUE(Await([&] { return Task()["progress_bytes"].asUInt64() > 0; }));
        if (stalled) {
            SignalServer(SIGSTOP);
        }
        const auto begin = steady_clock::now();
        EXPECT_EQ(zel_.End(SIGTERM), 0);
        EXPECT_LT(steady_clock::now() - begin, std::chrono::seconds(stalled ? 8 : 2));
        if (stalled) {
            SignalServer(SIGCONT);
        }
        zel_.Start();
        EXPECT_THAT(Task()["last_error"].asString(), HasSubstr("the daemon was stopped"));
        EXPECT_EQ(Task()["sync_result"].asInt32(), ZEL::TASK_RESULT_FAILED);
    }
    AwaitEqual("made up for");
    EXPECT_EQ(Runs().front()["reason"].asString(), "retry");
}

TEST_F(DaemonTest, OneDaemonAtATimeWithAConfigurationThatPasses) {
    zel_.Start();
    test::DaemonProcess second(folder_.Path("client"), folder_.Path("second.log"));
    EXPECT_THROW(second.Start(), std::runtime_error);
    EXPECT_THAT(second.Log(), HasSubstr("another zel_daemon runs already"));
    Settings("workers=\"7\"\n");
    const std::string daemon = "TARQ_ROOT=" + folder_.Path("client") + " " ZEL_DAEMON;
    test::Run(daemon + " --reload");
    const std::pair<const char*, const char*> wrong[] = {
        {"workers=\"many\"\n", "workers is 'many', not a number from 1 to 32"},
        {"# workers\n\nworker=\"3\"\n", "line 8: key 'worker' is unknown, there are gather_max_ms"},
        {"gather_ms=\"9\"\n", "line 6: key 'gather_ms' is there twice"},
        {"[deamon]\nworkers=\"3\"\n", "line 6: section [deamon] is unknown"},
        {"; workers\n", "line 6: '; workers' is neither a [section] nor a key"},
        {"group=\"no such group\"\n", "group is 'no such group'"},
    };
    const auto refuse = [&](const std::string& how, int expected, const std::string& why) {
        int status = 0;
        const std::string said = test::Command(daemon + how).Finish(status);
        EXPECT_THAT(said, AllOf(HasSubstr("/usr/tarq/etc/zel_daemon.conf"), HasSubstr(why)));
        EXPECT_EQ(status, expected) << said;
    };
    for (const auto& [text, why] : wrong) {
        Settings(text);
        refuse(" --reload", 1, why);
    }
    zel_.Signal(SIGHUP);
    EXPECT_TRUE(Await([&] { return zel_.Log().find("'no such group'") != std::string::npos; }));
    EXPECT_EQ(zel_.Ask("daemon_status")["workers"].asInt32(), 7);
    EXPECT_EQ(zel_.End(SIGTERM), 0);
    refuse(" --foreground", 3, "'no such group'");  // systemd does not try this again
    refuse("", 3, "'no such group'");
    int status = 0;
    EXPECT_THAT(test::Command(daemon + " --reload").Finish(status), HasSubstr("no daemon answers"));
    EXPECT_EQ(status, 1);
}

}  // namespace

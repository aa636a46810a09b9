// The daemon as a whole, against a real server: whatever happens on disk, to the daemon, to the
// server or on the socket, both sides are equal in the end and nothing is done needlessly.
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

/// Every entry below a folder with its content; of a link its target, because the server keeps
/// links in files.
std::map<std::string, std::string> TreeOf(const std::string& folder) {
    std::map<std::string, std::string> tree;
    std::error_code ignored;  // what vanishes meanwhile
    for (fs::recursive_directory_iterator at(folder, ignored), end; at != end;
         at.increment(ignored)) {
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
                            {"pswd", "secret"},         {"schedule_mode", static_cast<int>(mode)}};
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
        const std::string config = folder_.Path("server/usr/tarq/etc/zel_server/rsyncd.conf");
        for (const auto& process : fs::directory_iterator("/proc")) {
            const std::string line = test::ReadFile(process.path() / "cmdline");
            if (line.find(config) != std::string::npos && line.rfind("rsync", 0) == 0) {
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
    // 16 paths a run at most, and a run begins only when the one before has ended.
    EXPECT_LE(RsyncRuns() - before, 100u);
}

TEST_F(DaemonTest, AnOverflowOfTheQueueIsMadeUpForByOneComparison) {
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
    EXPECT_THAT(zel_.Log(), HasSubstr("too many changes at once; it is compared whole"));
    EXPECT_LE(RsyncRuns() - before, 12u);
}

TEST_F(DaemonTest, WhatTheKernelDoesNotWatchIsComparedNowAndThen) {
    for (int i = 0; i < 40; ++i) {
        Write("d" + std::to_string(i) + "/f", "x");
    }
    Settings("poll_seconds=\"1\"\n");
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
                fs::rename(path, Path(), ignored);
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
    EXPECT_THAT(Task()["last_error"].asString(), HasSubstr("'docs' belongs to another client"));
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
        {add, "paused", {1}},
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

TEST_F(DaemonTest, AnotherUserIsToldThatHeMayNot) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root to become another user";
    }
    zel_.Start();
    AddTask(ZEL::SCHD_MODE_MANUAL);
    for (const std::string& opened : {folder_.Path(), zel_.Socket()}) {
        chmod(opened.c_str(), 0777);
    }
    const pid_t child = fork();
    if (child == 0) {
        const bool dropped = setgid(65534) == 0 && setuid(65534) == 0;
        const auto told = [&]() noexcept {
            return zel_.Ask("task_remove", "t")["error"].asString();
        };
        _exit(dropped && told().find("only root") != std::string::npos ? 0 : 1);
    }
    int status = -1;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(Task()["name"].asString(), "t");
    EXPECT_EQ(Result(Request("task_remove", "t")), 0);
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
        EXPECT_LT(steady_clock::now() - begin, std::chrono::seconds(stalled ? 3 : 2));
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

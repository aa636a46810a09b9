// Files that come back from a whole server to a whole client: as they are there, and as they stood
// at a time.
#include <linux/landlock.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/sysmacros.h>

#include <regex>

#include "ZEL/sync_obj.h"
#include "programs/zelctl/restore/confine.h"
#include "tests/integration/client_and_server.h"
#include "tests/integration/daemon_process.h"
#include "tests/support/testing.h"

using test::Ended;
using test::Must;
using namespace testing;

namespace {

/// A tree that changes at random in all ways in which one can.
class ChangingTree {
public:
    explicit ChangingTree(std::string folder) : folder_(std::move(folder)) {}

    void Change() {
        const std::string path = RandomPath();
        std::error_code ignored;  // what is not there, or would go into itself
        switch (Below(8)) {
            case 0:
                fs::remove_all(path, ignored);
                return;
            case 1:
                MakeRoom(path);
                return fs::create_symlink("target " + Number(), path);
            case 2:
                MakeRoom(path);
                ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
                return;
            case 3: {
                const std::string to = RandomPath();
                MakeRoom(to);
                return fs::rename(path, to, ignored);
            }
            default:
                MakeRoom(path);
                std::ofstream(path) << Number();
                chmod(path.c_str(), static_cast<mode_t>(0600 | Below(0100)));
        }
    }

    void Move() {
        const std::string from = RandomPath();
        const std::string to = RandomPath();
        std::error_code ignored;
        if (fs::exists(fs::symlink_status(from)) && !fs::exists(fs::symlink_status(to, ignored)) &&
            fs::is_directory(fs::path(to).parent_path(), ignored)) {
            fs::rename(from, to, ignored);
        }
    }

private:
    size_t Below(size_t bound) { return random_() % bound; }
    std::string Number() { return std::to_string(++number_); }
    // A few names on three levels, so that they meet each other and change their kinds.
    std::string RandomPath() {
        static const std::vector<std::string> names = {
            "a", "b", "-rf", "#x", "two\nlines", "\xc3\xa4 \xff\"'*", "\\#012", ".zel_version"};
        std::string path = folder_;
        for (size_t level = Below(3) + 1; level > 0; --level) {
            path += "/" + names[Below(names.size())];
        }
        return path;
    }
    // Nothing is at the path, and what is above it are folders.
    void MakeRoom(const fs::path& path) {
        std::error_code ignored;
        for (fs::path above = path.parent_path(); above != folder_; above = above.parent_path()) {
            if (!fs::is_directory(fs::symlink_status(above, ignored))) {
                fs::remove(above, ignored);
            }
        }
        fs::create_directories(path.parent_path());
        fs::remove_all(path);
    }

    const std::string folder_;
    std::mt19937 random_{20261122};
    int number_ = 0;
};

/// All but the folders: one that was deleted when it was empty does not come back.
std::map<std::string, std::string> FilesOf(const std::string& folder) {
    std::map<std::string, std::string> files;
    for (const auto& entry : fs::recursive_directory_iterator(folder)) {
        struct stat facts = {};
        EXPECT_EQ(lstat(entry.path().c_str(), &facts), 0);
        if (S_ISDIR(facts.st_mode)) {
            continue;
        }
        std::ostringstream text;
        text << std::oct << facts.st_mode << std::dec << " " << facts.st_mtim.tv_sec << "."
             << facts.st_mtim.tv_nsec << " "
             << (S_ISREG(facts.st_mode)   ? test::ReadFile(entry.path())
                 : S_ISLNK(facts.st_mode) ? fs::read_symlink(entry.path()).string()
                                          : "");
        files[entry.path().string().substr(folder.size())] = text.str();
    }
    return files;
}

/// The next whole second, as --at takes it, when that has passed.
std::string NextSecond() {
    const time_t second = time(nullptr) + 1;
    std::this_thread::sleep_until(std::chrono::system_clock::from_time_t(second) +
                                  std::chrono::milliseconds(20));
    char text[32];
    struct tm local = {};
    strftime(text, sizeof text, "%Y-%m-%d %H:%M:%S", localtime_r(&second, &local));
    return text;
}

class RestoreTest : public testing::Test, public test::ClientAndServer {
protected:
    test::Outcome Ask(const std::string& command, const std::string& more) const {
        return Client(command + " -s 127.0.0.1 -u alice --password-file - " + more,
                      "secret words\n");
    }
    void Push() const { EXPECT_THAT(Ask("push", "docs"), Ended(0)); }
    /// Kills everything in a push, at both ends, and begins anew.
    void DieInAPush(int milliseconds) {
        std::thread push([this] { Ask("push", "docs"); });
        std::this_thread::sleep_for(std::chrono::milliseconds(30 + milliseconds));
        for (const auto& entry : fs::directory_iterator("/proc")) {
            const std::string number = entry.path().filename();
            const bool is_ours =
                isdigit(number.front()) != 0 &&
                test::ReadFile(entry.path() / "cmdline").find(folder_.Path()) != std::string::npos;
            if (is_ours) {
                kill(std::stoi(number), SIGKILL);
            }
        }
        push.join();
        StopServer();
        StartServer();
    }
    /// Of the copy, as a restore would have them.
    std::map<std::string, std::string> CopiedFiles() const {
        const std::string to = folder_.Path("copied");
        fs::remove_all(to);
        const test::Outcome outcome = Restore("--to " + to);
        // 1: what is moved or deleted meanwhile is not restored.
        EXPECT_THAT(outcome.exit_code, AnyOf(0, 1)) << outcome.output;
        return FilesOf(to);
    }
    test::Outcome Restore(const std::string& more) const {
        return Ask("restore --share docs", more);
    }
    test::Outcome Versions(const std::string& more = "") const {
        return Ask("versions --share docs", more);
    }

    struct Moment {
        std::string at;
        std::map<std::string, std::string> files;
    };
    /// Each tree comes back as it was, and single paths as they stood in the middle: so many.
    void ExpectEach(const std::vector<Moment>& moments, size_t paths) const {
        size_t number = 0;
        for (const Moment& moment : moments) {
            const std::string to = folder_.Path("back" + std::to_string(number++));
            EXPECT_THAT(Restore("--to " + to + " --at '" + moment.at + "'"), Ended(0));
            EXPECT_EQ(FilesOf(to), moment.files) << moment.at;
        }
        const Moment& moment = moments[moments.size() / 2];
        for (const auto& [path, facts] : moment.files) {
            if (paths-- == 0) {
                return;
            }
            const std::string to = folder_.Path("one");
            const std::string quoted = std::regex_replace(path, std::regex("'"), "'\\''");
            EXPECT_THAT(Restore("--to " + to + " --at '" + moment.at + "' -- '" + quoted + "'"),
                        Ended(0))
                << path;
            EXPECT_EQ(FilesOf(to), (std::map<std::string, std::string>{{path, facts}}));
            fs::remove_all(to);
        }
    }
};

TEST_F(RestoreTest, FilesComeBackAsTheyWereAndNothingThatIsThereIsLost) {
    const std::string back = folder_.Path("back");
    EXPECT_THAT(Restore("--to " + back), Ended(4, "holds no copy"));
    EXPECT_FALSE(fs::exists(back));
    Write("#sub/deep/#f", "f");
    Write("program", "p");
    chmod((source_ + "/program").c_str(), 06755);
    fs::create_directory(source_ + "/empty");
    fs::create_symlink("/etc", source_ + "/link");
    if (geteuid() == 0) {
        ASSERT_EQ(mknod((source_ + "/null").c_str(), S_IFCHR | 0644, makedev(1, 3)), 0);
        ASSERT_EQ(chown((source_ + "/a.txt").c_str(), 1234, 77), 0);
    }
    chmod(source_.c_str(), 0750);
    Push();

    EXPECT_THAT(Restore("-n --to " + back), Ended(0, "restore #sub/deep/#f (1 B)\n"));
    EXPECT_FALSE(fs::exists(back));
    EXPECT_THAT(Restore("--to " + back), Ended(0, "5 files restored"));
    const auto difference = [&](const std::string& folder) {
        return test::RunProgram("", {"rsync", "-niaAX", "--delete", "--modify-window=-1",
                                     source_ + "/", folder + "/"})
            .output;
    };
    EXPECT_EQ(difference(back), "");

    // A folder with something in it keeps that, and its own mode; links in it lead nowhere.
    const std::string filled = folder_.Path("filled");
    folder_.Write("filled/a.txt", "mine");
    folder_.Write("elsewhere/deep/mine", "mine");
    chmod(filled.c_str(), 0700);
    fs::create_symlink(folder_.Path("elsewhere"), filled + "/#sub");
    Restore("--to " + filled);
    EXPECT_EQ(test::ReadFile(filled + "/a.txt"), "mine");
    EXPECT_THAT(Restore("--overwrite --to " + filled), Ended(0));
    EXPECT_EQ(test::ReadFile(filled + "/a.txt"), "alpha");
    EXPECT_FALSE(fs::is_symlink(filled + "/#sub"));
    EXPECT_FALSE(fs::exists(folder_.Path("elsewhere/deep/#f")));
    EXPECT_EQ(fs::status(filled).permissions(), fs::perms(0700));
    chmod(filled.c_str(), 0750);
    EXPECT_THAT(difference(filled), AnyOf("", ".d..t...... ./\n"));

    const std::string part = folder_.Path("part");
    EXPECT_THAT(Restore("--to " + part + " '/#sub/deep/' sub/b.txt"), Ended(0, "2 files restored"));
    EXPECT_TRUE(fs::exists(part + "/#sub/deep/#f"));
    EXPECT_FALSE(fs::exists(part + "/a.txt"));
    EXPECT_THAT(Restore("--to " + part + " nope"), Ended(1, "the copy has no such path"));
    EXPECT_THAT(Restore("--to " + part + " ../docs"), Ended(2, "a '..'"));
    EXPECT_THAT(Restore("--to " + part + "/sub/b.txt"), Ended(3, "Not a directory"));
    EXPECT_THAT(Client("restore docs --to " + part), Ended(3, "daemon is not running"));
    EXPECT_THAT(Client("restore --to " + part), Ended(2, "which task?"));
}

TEST_F(RestoreTest, EachTreeOfThePastComesBackAcrossMoves) {
    folder_.Write("client/usr/tarq/etc/zel_daemon.conf",
                  "[daemon]\ngather_ms=\"50\"\ngather_max_ms=\"500\"\nretry_first_ms=\"200\"\n");
    test::DaemonProcess zel(folder_.Path("client"), folder_.Path("zel_daemon.log"));
    zel.Start();
    ZEL::PObject task;
    task = ZEL::PObject::Map{{"command", "task_add"},
                             {"name", "t"},
                             {"server_ip", "127.0.0.1"},
                             {"user", "alice"},
                             {"pswd", "secret words"},
                             {"schedule_mode", 1},
                             {"brake", 0}};
    task["share_list"].asArray().emplace_back("docs");
    ASSERT_EQ(zel.Ask(task)["result"].asInt32(), 0);
    const auto await_copy = [&] {
        return test::Await([&] {
            const ZEL::PObject now = zel.Ask("task_show", "t")["task"];
            return now["status"].asInt32() == ZEL::TASK_STATUS_IDLE &&
                   now["pending"].asUInt64() == 0 && !now.hasMember("retry_in") &&
                   CopiedFiles() == FilesOf(source_);
        });
    };
    ASSERT_TRUE(await_copy());
    std::vector<Moment> moments;
    ChangingTree tree(source_);
    for (int i = 0; i < 10; ++i) {
        for (int part = 0; part < 3; ++part) {
            for (int move = 0; move < 40; ++move) {
                tree.Move();
            }
            for (int change = 0; change < 8; ++change) {
                tree.Change();
            }
            ASSERT_TRUE(await_copy()) << zel.Log();
        }
        moments.push_back({NextSecond(), FilesOf(source_)});
    }
    zel.End(SIGTERM);
    EXPECT_GT(fs::file_size(storage_ + "/.versions/docs/moves"), 1500U);
    ExpectEach(moments, SIZE_MAX);  // also what has had a place since
}

TEST_F(RestoreTest, EachTreeOfThePastComesBackAsItWas) {
    std::vector<Moment> moments;
    ChangingTree tree(source_);
    for (int i = 0; i < 10; ++i) {
        for (int run = 0; run < 3; ++run) {
            for (int change = 0; change < 25; ++change) {
                tree.Change();
            }
            if (run == 1) {
                DieInAPush(i * 20);
            }
            Push();
        }
        // What is said in seconds lies between the end of one push and the beginning of the next.
        moments.push_back({NextSecond(), FilesOf(source_)});
    }
    EXPECT_THAT(Versions(), Ended(0, "UNTIL"));
    EXPECT_THAT(Versions("-- '/no such'"), Ended(0, "nothing of docs: no such"));
    ExpectEach(moments, 5);
    EXPECT_THAT(Restore("--to " + folder_.Path("none") + " --at '2001-02-03 04:05'"),
                Ended(4, "nothing stood there at that time"));
    EXPECT_THAT(Restore("--to " + folder_.Path("none") + " --at '2999-02-03 04:05'"),
                Ended(2, "that has passed"));
    EXPECT_FALSE(fs::exists(folder_.Path("none")));
    // What a crash has left goes, too; and neither the copy nor a version was touched.
    fs::create_directories(storage_ + "/.restores/left/over");
    EXPECT_THAT(Versions(), Ended(0));
    EXPECT_TRUE(test::Await([&] { return fs::is_empty(storage_ + "/.restores"); }));
    EXPECT_THAT(Restore("--to " + folder_.Path("now")), Ended(0));
    EXPECT_EQ(FilesOf(folder_.Path("now")), FilesOf(source_));
}

TEST(Confinement, NothingIsWrittenOutsideOfTheFolder) {
    const test::TempRoot root;
    const std::string inside = root.Path("inside");
    const std::string outside = root.Path("outside");
    fs::create_directories(inside);
    fs::create_directories(outside);
    root.Write("outside/file", "mine");
    fs::create_directory_symlink(outside, inside + "/link");
    if (syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION) < 1) {
        GTEST_SKIP() << "this kernel has no Landlock";
    }
    const pid_t child = fork();
    if (child == 0) {
        zelctl::WriteOnlyBelow(inside);
        const bool right =
            mkdir((inside + "/made").c_str(), 0700) == 0 &&
            mkdir((inside + "/link/made").c_str(), 0700) != 0 &&
            unlink((outside + "/file").c_str()) != 0 &&
            open((inside + "/link/file").c_str(), O_WRONLY | O_TRUNC | O_CLOEXEC) < 0 &&
            rename((inside + "/made").c_str(), (inside + "/moved").c_str()) == 0;
        _exit(right ? 0 : 1);
    }
    int status = -1;
    waitpid(child, &status, 0);
    EXPECT_EQ(status, 0);
    EXPECT_EQ(test::ReadFile(outside + "/file"), "mine");
}

// What lies in a copy was written by whoever has the account's password.
TEST_F(RestoreTest, NothingInACopyLeadsTheServerElsewhere) {
    folder_.Write("outside/deep/secret", "secret");
    folder_.Write("outside/b", "secret");
    Push();
    // As fake super keeps no links, put them where a client that goes bad would.
    const std::string versions =
        storage_ + "/.versions/docs/20371231T000000.000000000-" + std::string(32, 'a');
    fs::create_directories(versions);
    fs::create_directory_symlink(folder_.Path("outside"), versions + "/deep");
    fs::create_directory_symlink(folder_.Path("outside"), storage_ + "/docs/link");
    fs::remove(storage_ + "/docs/.zel_versions");
    fs::create_directory_symlink(folder_.Path("outside"), storage_ + "/docs/.zel_versions");
    const std::string to = folder_.Path("to");
    const std::string now = NextSecond();
    for (const char* path : {"", "link", "link/deep", "deep/secret"}) {
        Restore("--to " + to + " --at '" + now + "' " + path);
    }
    EXPECT_THAT(FilesOf(to), Not(Contains(Pair(_, HasSubstr("secret")))));
}

}  // namespace

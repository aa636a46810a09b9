#include "programs/zel_daemon/watcher.h"

#include <poll.h>
#include <sched.h>
#include <sys/inotify.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/syscall.h>

#include "tests/support/testing.h"

namespace {

using namespace testing;
using zel_daemon::Watcher;
using zel_daemon::WatchLoss;

/// Called before a folder gets its watch; an error that is returned takes the watch's place.
std::function<int(ino_t folder)> before_watch;

}  // namespace

extern "C" int inotify_add_watch(int fd, const char* path, uint32_t mask) {
    struct stat status;
    if (before_watch && stat(path, &status) == 0) {
        if (const int error = before_watch(status.st_ino)) {
            errno = error;
            return -1;
        }
    }
    return static_cast<int>(syscall(SYS_inotify_add_watch, fd, path, mask));
}

namespace {

/// A folder `s` that is watched as share "s", and one beside it that is not.
class WatcherTest : public testing::Test {
protected:
    WatcherTest() {
        EXPECT_TRUE(watcher_.Open());
        fs::create_directories(Path());
        fs::create_directories(Outside());
    }
    ~WatcherTest() override { before_watch = nullptr; }

    /// Of each share, and where a folder is not watched, why.
    using Losses = std::map<std::string, std::pair<WatchLoss::Kind, int>>;
    static Losses Unwatched(int error) { return {{"s", {WatchLoss::kUnwatched, error}}}; }
    static Losses Gone(const std::string& share) { return {{share, {WatchLoss::kFolderGone, 0}}}; }

    std::string Path(const std::string& path = "") const { return folder_.Path("s") + path; }
    std::string Outside(const std::string& path = "") const { return folder_.Path("o") + path; }
    void Write(const std::string& path) const { std::ofstream(Path(path)) << "x"; }

    void Work() {
        pollfd waiting = {watcher_.Fd(), POLLIN, 0};
        while (watcher_.Work(std::chrono::milliseconds(5)) || poll(&waiting, 1, 0) > 0) {
        }
    }
    void Start() {
        watcher_.Add("s", Path());
        Work();
        EXPECT_THAT(TakeTold(), IsEmpty());
    }

    /// The paths told since the last call; of other shares than "s" behind their name.
    std::set<std::string> TakeTold() { return std::exchange(told_, {}); }
    /// What was lost since the last call. That a share says a thing once is checked as it is told.
    Losses TakeLosses() { return std::exchange(losses_, {}); }
    std::set<std::string> ToldAfterWork() {
        Work();
        return TakeTold();
    }
    /// That all folders are watched, each under its own path, and no other.
    void ExpectAllWatched(const std::string& what = "") {
        std::set<std::string> probes;
        for (const auto& entry : fs::recursive_directory_iterator(Path())) {
            if (entry.is_directory() && !entry.is_symlink()) {
                probes.insert(entry.path().string().substr(Path().size()) + "/probe");
            }
        }
        probes.insert("/probe");
        for (const std::string& probe : probes) {
            Write(probe);
            unlink(Path(probe).c_str());
        }
        EXPECT_EQ(ToldAfterWork(), probes) << what;
        EXPECT_EQ(watcher_.Stats("s").folders, probes.size()) << what;
        EXPECT_FALSE(watcher_.Stats("s").scanning) << what;
        EXPECT_EQ(KernelWatches(), probes.size()) << what;
    }
    size_t KernelWatches() const {
        std::ifstream info("/proc/self/fdinfo/" + std::to_string(watcher_.Fd()));
        size_t count = 0;
        for (std::string line; std::getline(info, line);) {
            count += line.rfind("inotify", 0) == 0;
        }
        return count;
    }

    void Told(const std::string& share, const std::string& told) {
        const std::string path =
            told.size() > 1 ? told.substr(0, told.find_last_not_of('/') + 1) : told;
        told_.insert(share == "s" ? path : share + ":" + path);
        std::exchange(on_told_, [] {})();
    }

    test::TempFolder folder_;
    std::set<std::string> told_;
    Losses losses_;
    std::vector<std::string> moved_;
    std::function<void()> on_told_ = [] {};
    Watcher watcher_{
        [this](const std::string& share, const std::string& told) { Told(share, told); },
        [this](const std::string& share, const std::string& from, const std::string& to) {
            moved_.push_back((share == "s" ? from : share + ":" + from) + " " + to);
            Told(share, from);
            Told(share, to);
        },
        [this](const std::string& share, const WatchLoss& loss) {
            const auto what = std::pair(loss.kind, loss.error);
            EXPECT_TRUE(losses_.emplace(share, what).second) << share << " says it twice";
        }};
};

TEST_F(WatcherTest, NewFoldersAreToldDuringTheFirstSearchToo) {
    fs::create_directories(Path("/a"));
    fs::create_directories(Path("/b"));
    int watched = 0;
    before_watch = [&](ino_t) {
        if (++watched == 2) {  // the share's own folder has been read
            fs::create_directories(Path("/new/x/y"));
        }
        return 0;
    };
    watcher_.Add("s", Path());
    while (watcher_.Work(std::chrono::milliseconds(0))) {
    }
    EXPECT_THAT(TakeTold(), ElementsAre("/new", "/new/x", "/new/x/y"));
    ExpectAllWatched();
}

TEST_F(WatcherTest, AFolderMayTakeThePlaceOfOneThatIsHeldOpen) {
    fs::create_directories(Path("/held"));
    fs::create_directories(Outside("/over/sub"));
    Start();
    const int held = open(Path("/held").c_str(), O_RDONLY);  // the kernel keeps its watch for now
    ASSERT_EQ(rename(Outside("/over").c_str(), Path("/held").c_str()), 0);
    EXPECT_THAT(ToldAfterWork(), ElementsAre("/held", "/held/sub"));
    ExpectAllWatched();
    close(held);
}

TEST_F(WatcherTest, NoSymbolicLinkLeadsOutOfTheShare) {
    fs::create_directories(Outside("/secret"));
    fs::create_directories(Path("/known/secret"));
    symlink(Outside().c_str(), Path("/link").c_str());
    Start();
    const auto replace = [&](const std::string& name) {
        rename(Path(name).c_str(), Outside(name).c_str());
        symlink(Outside().c_str(), Path(name).c_str());
    };
    // Before it is opened; after it was opened; and on the way to a folder that waits.
    fs::create_directories(Path("/new/secret"));
    replace("/new");
    Work();
    fs::create_directory(Path("/late"));
    before_watch = [&](ino_t) {
        before_watch = nullptr;
        replace("/late");
        return 0;
    };
    Work();
    fs::create_directories(Path("/known/secret/more"));
    fs::create_directories(Outside("/secret/more"));
    struct stat secret;
    ASSERT_EQ(stat(Outside("/secret/more").c_str(), &secret), 0);
    bool replaced = false;
    before_watch =
        [&](ino_t folder) {  // of the share's own folder first: it is opened for a search
            EXPECT_NE(folder, secret.st_ino);
            if (!std::exchange(replaced, true)) {
                replace("/known");
            }
            return 0;
        };
    Work();
    before_watch = nullptr;
    TakeTold();
    for (const char* name : {"/f", "/secret/f", "/late/f", "/new/f", "/known/secret/f"}) {
        std::ofstream(Outside(name)) << "x";
    }
    EXPECT_THAT(ToldAfterWork(), IsEmpty());
    ExpectAllWatched();
}

TEST_F(WatcherTest, AfterAnOverflowAllIsFoundAgain) {
    fs::create_directories(Path("/stays/sub"));
    fs::create_directories(Path("/goes/sub"));
    Write("/f");
    Write("/g");
    watcher_.Add("t", Path("/stays"));
    Start();
    for (int i = 0; i < 20000; ++i) {  // no two alike in a row: the kernel would join them
        chmod(Path(i % 2 ? "/f" : "/g").c_str(), 0600);
    }
    fs::remove_all(Path("/goes"));
    fs::create_directories(Path("/stays/new/deep"));
    Work();
    EXPECT_EQ(losses_,
              (Losses{{"s", {WatchLoss::kOverflow, 0}}, {"t", {WatchLoss::kOverflow, 0}}}));
    watcher_.Remove("t");
    told_.clear();
    ExpectAllWatched();
}

TEST_F(WatcherTest, WhatCannotBeWatchedIsSaidOnceInASearch) {
    for (const int error : {ENOSPC, EACCES}) {
        fs::remove_all(Path());
        fs::create_directories(Path("/a/b"));
        fs::create_directories(Path("/c/d"));
        std::set<ino_t> watched;
        before_watch = [&watched, error](ino_t folder) {
            return watched.size() < 3  ? watched.insert(folder), 0
               : watched.count(folder) ? 0
                                       : error;
        };
        Start();
        EXPECT_EQ(TakeLosses(), Unwatched(error));
        EXPECT_FALSE(watcher_.Stats("s").complete || watcher_.Stats("s").scanning);
        Write("/f");
        fs::create_directories(Path("/new/below"));
        EXPECT_THAT(ToldAfterWork(), ElementsAre("/f", "/new"));
        EXPECT_EQ(TakeLosses(), Unwatched(error));
        watcher_.Rescan("s");
        Work();
        EXPECT_EQ(TakeLosses(), Unwatched(error));
        // A folder that shows a sign of life is tried again; then nothing is missing.
        before_watch = nullptr;
        for (const char* name : {"/a", "/c", "/new", "/a/b", "/c/d"}) {
            chmod(Path(name).c_str(), 0700);
            Work();
        }
        TakeTold();
        ExpectAllWatched();
        EXPECT_TRUE(watcher_.Stats("s").complete);
        EXPECT_THAT(losses_, IsEmpty());
        watcher_.Remove("s");
    }
}

TEST_F(WatcherTest, WithoutDescriptorsNothingIsMissedUnsaid) {
    fs::create_directories(Path("/a/b"));
    Start();
    fs::create_directories(Path("/a/new/below"));
    struct rlimit before;
    ASSERT_EQ(getrlimit(RLIMIT_NOFILE, &before), 0);
    const struct rlimit none = {0, before.rlim_max};
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &none), 0);
    Work();
    ASSERT_EQ(setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_EQ(TakeLosses(), Unwatched(EMFILE));
    EXPECT_FALSE(watcher_.Stats("s").complete);
    watcher_.Rescan("s");
    EXPECT_THAT(ToldAfterWork(), IsSupersetOf({"/a/new", "/a/new/below"}));
    ExpectAllWatched();
    EXPECT_TRUE(watcher_.Stats("s").complete);
}

TEST_F(WatcherTest, APathTooLongToBeSentIsUnreadable) {
    const std::string name(200, 'n');
    Start();
    int depth = 0;
    for (int at = open(Path().c_str(), O_RDONLY); at >= 0 && depth < 40; ++depth) {
        ASSERT_EQ(mkdirat(at, name.c_str(), 0700), 0);
        const int below = openat(at, name.c_str(), O_RDONLY);
        close(at);
        at = below;
    }
    Work();
    EXPECT_EQ(TakeLosses(), Unwatched(ENAMETOOLONG));
    EXPECT_FALSE(watcher_.Stats("s").complete);
    EXPECT_EQ(watcher_.Stats("s").folders, 1u + (PATH_MAX - 1) / 201);
    fs::rename(Path("/" + name + "/" + name), Path("/m"));
    Work();
    EXPECT_EQ(watcher_.Stats("s").folders, 3u + (PATH_MAX - 3) / 201) << "the way is shorter";
    EXPECT_EQ(TakeLosses(), Unwatched(ENAMETOOLONG));
    fs::rename(Path("/m"), Outside("/m"));
    fs::rename(Path("/" + name), Outside("/" + name));
    Work();
    EXPECT_TRUE(watcher_.Stats("s").complete);
}

TEST_F(WatcherTest, SaysWhenTheFolderIsGone) {
    const std::function<void()> kWays[] = {
        [&] { fs::remove_all(Path()); },
        [&] { rename(Path().c_str(), Outside("/moved").c_str()); },
        [&] {  // with the folder above it, which nothing tells: noticed at the next search
            watcher_.Add("s", Path("/a/b"));
            Work();
            rename(Path("/a").c_str(), Path("/c").c_str());
            fs::create_directories(Path("/a/b"));
            fs::create_directory(Path("/c/b/new"));
        },
        [&] {  // before it was looked at
            watcher_.Add("s", Path("/none"));
        },
    };
    for (const auto& way : kWays) {
        fs::create_directories(Path("/a/b"));
        Start();
        way();
        Work();
        EXPECT_EQ(TakeLosses(), Gone("s"));
        EXPECT_FALSE(watcher_.Stats().complete);
        told_.clear();
    }
}

TEST_F(WatcherTest, LetsAVolumeGoAndSaysSo) {
    const std::string user = "0 " + std::to_string(geteuid()) + " 1";
    const std::string group = "0 " + std::to_string(getegid()) + " 1";
    const auto mount_at = [&](const std::string& path) {
        return mount("test", Path(path).c_str(), "tmpfs", 0, nullptr) == 0;
    };
    const pid_t child = fork();
    if (child == 0) {  // in namespaces of its own: nothing of this is seen outside
        if (unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) {
            _exit(77);
        }
        std::ofstream("/proc/self/uid_map") << user;
        std::ofstream("/proc/self/setgroups") << "deny";
        std::ofstream("/proc/self/gid_map") << group;
        if (!mount_at("")) {
            _exit(77);
        }
        fs::create_directories(Path("/mounted"));
        EXPECT_TRUE(mount_at("/mounted"));
        fs::create_directories(Path("/mounted/below"));
        Start();
        ExpectAllWatched("with a volume inside");
        EXPECT_EQ(umount(Path("/mounted").c_str()), 0);
        EXPECT_THAT(ToldAfterWork(), Contains("/mounted"));
        ExpectAllWatched("without it");
        EXPECT_EQ(umount(Path().c_str()), 0);
        Work();
        EXPECT_EQ(TakeLosses(), Gone("s"));
        _exit(HasFailure());
    }
    int status = -1;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    if (WIFEXITED(status) && WEXITSTATUS(status) == 77) {
        GTEST_SKIP() << "no namespaces or mounts to be had";
    }
    EXPECT_EQ(status, 0);
}

TEST_F(WatcherTest, WhatWasMovedIsToldAsOne) {
    fs::create_directories(Path("/a/deep"));
    fs::create_directories(Path("/in"));
    Write("/f");
    Start();
    fs::rename(Path("/f"), Path("/a/f"));
    fs::rename(Path("/a"), Path("/b\n"));
    fs::rename(Path("/b\n/deep"), Path("/deep"));
    Work();
    EXPECT_THAT(moved_, ElementsAre("/f /a/f", "/a/ /b\n", "/b\n/deep/ /deep"));
    EXPECT_THAT(TakeTold(), IsSupersetOf({"/f", "/a/f", "/a", "/b\n", "/b\n/deep", "/deep"}));
    // Two that change places, and one that comes back.
    moved_.clear();
    const auto exchange = [&](const std::string& one, const std::string& other) {
        ASSERT_EQ(
            renameat2(AT_FDCWD, Path(one).c_str(), AT_FDCWD, Path(other).c_str(), RENAME_EXCHANGE),
            0);
    };
    exchange("/deep", "/b\n/f");
    exchange("/deep", "/b\n/f");
    Write("/once");
    fs::rename(Path("/once"), Path("/then"));
    fs::rename(Path("/then"), Path("/once"));
    Work();
    const std::string aside = "/b\n/f.exchanged";
    EXPECT_THAT(moved_,
                ElementsAre("/deep/ " + aside, "/b\n/f /deep", aside + "/ /b\n/f", "/deep " + aside,
                            "/b\n/f/ /deep", aside + " /b\n/f", "/once /then", "/then /once"));
    TakeTold();
    ExpectAllWatched();
    // Out and in again, to another share, and over a file.
    moved_.clear();
    watcher_.Add("inner", Path("/in"));
    Work();
    TakeTold();
    Write("/g");
    Write("/h");
    Write("/i");
    fs::rename(Path("/deep"), Outside("/deep"));
    fs::rename(Outside("/deep"), Path("/back"));
    fs::rename(Path("/g"), Path("/in/g"));
    fs::rename(Path("/h"), Path("/i"));
    EXPECT_THAT(ToldAfterWork(),
                IsSupersetOf({"/deep", "/back", "/g", "/in/g", "inner:/g", "/h", "/i"}));
    EXPECT_THAT(moved_, ElementsAre("/g /in/g", "/h /i"));
}

TEST_F(WatcherTest, SharesMayLieInEachOtherAndComeAndGo) {
    fs::create_directories(Path("/in/deep"));
    watcher_.Add("same", Path());
    watcher_.Add("inner", Path("/in"));
    watcher_.Add("s", Path());
    Work();
    EXPECT_EQ(watcher_.Stats().folders, 8u);
    Write("/in/deep/f");
    EXPECT_THAT(ToldAfterWork(), ElementsAre("/in/deep/f", "inner:/deep/f", "same:/in/deep/f"));
    chmod(Path("/in").c_str(), 0700);
    EXPECT_THAT(ToldAfterWork(), ElementsAre("/in", "inner:/", "same:/in"));
    // Without one of them, the others go on.
    watcher_.Remove("same");
    rename(Path("/in/deep").c_str(), Path("/deep").c_str());
    ToldAfterWork();
    Write("/deep/g");
    EXPECT_THAT(ToldAfterWork(), ElementsAre("/deep/g"));
    rename(Path("/in").c_str(), Path("/out").c_str());
    Work();
    EXPECT_EQ(TakeLosses(), Gone("inner"));
    watcher_.Remove("inner");
    told_.clear();
    ExpectAllWatched();
    // A share may even be replaced while a change of it is told.
    on_told_ = [&] { watcher_.Add("s", Path("/out")); };
    fs::create_directory(Path("/c"));
    Write("/out/f");
    EXPECT_THAT(ToldAfterWork(), ElementsAre("/c"));
    Write("/out/g");
    EXPECT_THAT(ToldAfterWork(), ElementsAre("/g"));
    EXPECT_EQ(watcher_.Stats().folders, 1u);
}

/// Random changes at random moments, also right in the middle of a search, with a copy that is kept
/// by what is told, as the daemon keeps its server's.
class WatcherModelTest : public WatcherTest {
protected:
    /// What of an entry must reach the copy: kind, mode, and for files a size that no other has.
    using State = std::pair<mode_t, off_t>;
    using Tree = std::map<std::string, State>;

    static bool IsWithin(const std::string& path, const std::string& folder) {
        return path == folder || path.rfind(folder + "/", 0) == 0;
    }

    /// The entry at `path`, which no link leads to, and all below it, as they are now.
    Tree TreeAt(const std::string& path) const {
        Tree tree;
        struct stat status;
        for (size_t end = path.find('/', 1); end != path.npos; end = path.find('/', end + 1)) {
            if (fs::is_symlink(Path(path.substr(0, end)))) {
                return tree;
            }
        }
        if (lstat(Path(path).c_str(), &status) != 0) {
            return tree;
        }
        // Only a folder's mode is its own: its size and times follow from what is in it.
        tree[path] = {status.st_mode, S_ISREG(status.st_mode) ? status.st_size : 0};
        if (S_ISDIR(status.st_mode)) {
            for (const auto& entry : fs::directory_iterator(Path(path))) {
                tree.merge(TreeAt(path + "/" + entry.path().filename().string()));
            }
        }
        return tree;
    }

    /// Brings the copy up to date in what was told, and in nothing else.
    void Synchronise() {
        for (const std::string& told : TakeTold()) {
            const std::string path = told.substr(0, told.find_last_not_of('/') + 1);
            for (auto at = copy_.begin(); at != copy_.end();) {
                at = IsWithin(at->first, path) ? copy_.erase(at) : std::next(at);
            }
            copy_.merge(TreeAt(path));
        }
    }

    std::string RandomPath() {
        std::string path;
        for (unsigned int depth = 1 + Random(4); depth > 0; --depth) {
            path += std::vector{"/a", "/b\n\xff", "/c"}[Random(3)];
        }
        return path;
    }

    unsigned int Random(unsigned int below) { return static_cast<unsigned int>(random_() % below); }

    /// Most of them fail, since the path is not there or not of the kind: that is as good.
    void ChangeSomething() {
        const std::string path = Path(RandomPath());
        const std::string other = Path(RandomPath());
        const std::string outside = Outside(std::string("/") + "abc"[Random(3)]);
        std::error_code ignored;
        const std::function<void()> changes[] = {
            [&] { Resize(path); },
            [&] { fs::remove_all(path, ignored); },
            [&] { rename(path.c_str(), other.c_str()); },
            [&] { renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, other.c_str(), RENAME_EXCHANGE); },
            [&] { rename(path.c_str(), outside.c_str()); },
            [&] { rename(outside.c_str(), path.c_str()); },
            [&] { fchmodat(AT_FDCWD, path.c_str(), Random(2) ? 0700 : 0750, AT_SYMLINK_NOFOLLOW); },
            [&] { symlink(Outside().c_str(), other.c_str()); },
            [&] { fs::create_directories(path, ignored); },
        };
        changes[std::min(Random(12), 8U)]();  // the last one most often
    }
    void Resize(const std::string& path) {
        const int file = open(path.c_str(), O_WRONLY | O_CREAT | O_NOFOLLOW, 0600);
        if (file >= 0) {
            EXPECT_EQ(ftruncate(file, ++last_size_), 0);
            close(file);
        }
    }

    std::mt19937 random_;
    off_t last_size_ = 0;
    Tree copy_;
};

TEST_F(WatcherModelTest, ACopyKeptByWhatIsToldStaysTrue) {
    Start();
    for (unsigned int seed = 1; seed <= 150 && !HasFailure(); ++seed) {
        random_.seed(seed);
        copy_ = TreeAt("");
        before_watch = [&](ino_t) {
            for (unsigned int i = Random(4) == 0 ? 1 + Random(3) : 0; i > 0; --i) {
                ChangeSomething();
            }
            return 0;
        };
        for (int i = 0; i < 120; ++i) {
            ChangeSomething();
            if (Random(4) == 0) {
                watcher_.Work(std::chrono::milliseconds(0));
            }
            if (Random(8) == 0) {
                Synchronise();
            }
        }
        before_watch = nullptr;
        Work();
        Synchronise();
        EXPECT_EQ(copy_, TreeAt("")) << "seed " << seed;
        ExpectAllWatched("seed " + std::to_string(seed));
    }
    EXPECT_THAT(losses_, IsEmpty());
}

TEST_F(WatcherModelTest, ChangesAtTheSameTimeLeaveAllWatched) {
    Start();
    for (unsigned int seed = 1; seed <= 10 && !HasFailure(); ++seed) {
        random_.seed(seed);
        std::atomic<bool> done{false};
        std::thread changes([&] {
            for (int i = 0; i < 1500; ++i) {
                ChangeSomething();
            }
            done = true;
        });
        while (!done) {
            watcher_.Work(std::chrono::milliseconds(1));
        }
        changes.join();
        Work();
        TakeTold();
        ExpectAllWatched("seed " + std::to_string(seed));
    }
    EXPECT_THAT(losses_, IsEmpty());
}

}  // namespace

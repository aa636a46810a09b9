// A whole client and a whole server: the programs as people run them, on a real rsync daemon and a
// real sshd.
#include <sys/mount.h>
#include <sys/ptrace.h>
#include <sys/stat.h>
#include <sys/wait.h>

#include <csignal>
#include <future>
#include <map>
#include <regex>
#include <set>
#include <tuple>

#include "tests/integration/client_and_server.h"
#include "tests/support/testing.h"

using test::Ended;
using test::Must;
using namespace testing;

namespace {

class PushTest : public testing::Test, public test::ClientAndServer {
protected:
    test::Outcome Push(const std::string& more = "", const std::string& password = "secret words",
                       const std::string& user = "alice", const std::string& before = "") const {
        return Client("push docs -s 127.0.0.1 --password-file - -u " + user + " " + more,
                      password + "\n", before);
    }
    void ExpectNextPushCompletes(const std::string& more = "",
                                 const std::string& user = "alice") const {
        EXPECT_THAT(Push(more, "secret words", user), Ended(0));
        ExpectCopyIsComplete();
    }
    /// The same as Client(), at a terminal at which somebody types.
    test::Outcome AtTerminal(const std::string& arguments, const std::string& typed) const {
        return test::RunProgram(folder_.Path("client"),
                                {"script", "-qec", ZELCTL " " + arguments, "/dev/null"},
                                typed + "\n");
    }
    static std::string KeyIn(const std::string& text) {
        std::smatch match;
        std::regex_search(text, match, std::regex("SHA256:[A-Za-z0-9+/]{43}"));
        return match.str();
    }
    /// Past the command line, straight at the server.
    std::string Ask(const std::string& text) const {
        const std::string received = folder_.Path("answer");
        fs::remove(received);
        Rsync("--early-input=" + folder_.Write("command", text) + " alice@127.0.0.1::zel_command/" +
              kSession + " " + received);
        return test::ReadFile(received);
    }
    std::string Command(const std::string& name, const std::string& lines) const {
        return Ask("session=\"" + kSession + "\"\ncommand=\"" + name +
                   "\"\nclientID=\"CLIENT-1\"\n" + lines + "\n");
    }
    int Rsync(const std::string& arguments) const {
        const std::string options = " --password-file=- --port=" + std::to_string(port_) + " ";
        return test::RunProgram("", {"sh", "-c", "rsync" + options + arguments}, "secret words\n")
            .exit_code;
    }

    /// What a run that writes has to ask for. Each has an ID of its own.
    static std::string Kept(char digit) {
        return " --backup --backup-dir=.zel_versions/" + std::string(32, digit) + " ";
    }
    /// The folders of the versions of "docs", the oldest first, once the server has taken them all.
    std::vector<std::string> Versions() const {
        const std::string left = storage_ + "/docs/.zel_versions";
        const std::string all = storage_ + "/.versions/docs";
        EXPECT_TRUE(test::Await([&left] { return fs::is_empty(left); }));
        std::set<std::string> folders;
        for (const auto& entry : fs::directory_iterator(all)) {
            folders.insert(entry.path());
        }
        return {folders.begin(), folders.end()};
    }
    static std::string RandomBytes(size_t count) {
        std::string bytes(count, '\0');
        std::ifstream("/dev/urandom").read(bytes.data(), static_cast<std::streamsize>(count));
        return bytes;
    }
    /// What is being written of a file, once it has so many bytes; empty until then.
    fs::path PartOf(const std::string& name, size_t bytes) const {
        std::error_code gone;
        for (fs::recursive_directory_iterator at(storage_ + "/docs/.zel_partial", gone), end;
             !gone && at != end; at.increment(gone)) {
            if (at->path().filename().string().find(name + ".") == 0 &&
                at->file_size(gone) >= bytes && WriterOf(at->path()) != 0) {
                return at->path();
            }
        }
        return {};
    }
    /// A process that has this file open; 0: none has.
    static pid_t WriterOf(const fs::path& file) {
        std::error_code gone;
        for (const auto& process : fs::directory_iterator("/proc")) {
            for (fs::directory_iterator fd(process.path() / "fd", gone), end; !gone && fd != end;
                 fd.increment(gone)) {
                if (fs::read_symlink(fd->path(), gone) == file) {
                    return std::stoi(process.path().filename());
                }
            }
        }
        return 0;
    }
    /// All files of the storage, by their inodes.
    std::map<ino_t, std::string> Everything() const {
        std::map<ino_t, std::string> files;
        std::error_code error;  // the server may still be putting something away
        do {
            files.clear();
            fs::recursive_directory_iterator entry(storage_, error);
            for (; !error && entry != fs::recursive_directory_iterator(); entry.increment(error)) {
                struct stat info = {};
                if (lstat(entry->path().c_str(), &info) == 0 && S_ISREG(info.st_mode)) {
                    files[info.st_ino] = test::ReadFile(entry->path());
                }
            }
        } while (error);
        return files;
    }

    const std::string kSession = std::string(32, 'b');
};

TEST_F(PushTest, OnlyTheChangeTravelsAndADeletionIsOne) {
    EXPECT_THAT(Push("--dry-run").output, HasSubstr("the server holds no copy yet"));
    EXPECT_TRUE(fs::is_empty(storage_));
    EXPECT_THAT(Server("clients --json").output, Not(HasSubstr("CLIENT-1")));
    EXPECT_THAT(Push().output,
                AllOf(HasSubstr("Paired with"), HasSubstr("3 files sent, 0 deleted")));
    ExpectCopyIsComplete();
    EXPECT_THAT(Push().output,
                AllOf(Not(HasSubstr("Paired")), HasSubstr("0 files sent, 0 deleted")));

    Write("new", "n");
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push("--dry-run").output,
                AllOf(HasSubstr("send    new (1 B)"), HasSubstr("delete  a.txt")));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    EXPECT_THAT(Push().output, HasSubstr("1 file sent, 1 deleted"));
    ExpectCopyIsComplete();
    EXPECT_THAT(Server("shares --json").output, HasSubstr("\"state\": \"complete"));
    // The one command line for both sides.
    EXPECT_THAT(test::Zelctl(folder_.Path("server"), "server shares"), Ended(0, "CLIENT-1"));

    // A part of the share takes nothing else with it.
    Write("sub/c.txt", "c");
    Write("top", "t");
    EXPECT_THAT(Push("--path /sub").output, HasSubstr("1 file sent, 0 deleted"));
    EXPECT_FALSE(fs::exists(storage_ + "/docs/top"));
    EXPECT_EQ(Push("--path '/no such'").exit_code, 3);

    // The share's own folder keeps its time and its mode, too.
    const auto facts = [](const std::string& folder) {
        struct stat info = {};
        stat(folder.c_str(), &info);
        return std::tuple(info.st_mtim.tv_sec, info.st_mtim.tv_nsec, info.st_mode);
    };
    chmod(source_.c_str(), 0750);
    EXPECT_THAT(Push("--path /top"), Ended(0));
    EXPECT_EQ(facts(storage_ + "/docs"), facts(source_));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/-n\n odd \xc3\xa4"));
    Write("top2", "t");
    EXPECT_THAT(Push(), Ended(0));
    EXPECT_EQ(facts(storage_ + "/docs"), facts(source_));
}

TEST_F(PushTest, OneBadShareDoesNotStopTheOthers) {
    Must(Server("account add mallory --password-file -", "secret words\n"));
    for (const std::string share : {"away", "taken", "last"}) {
        folder_.Write(share + "/file", share);
        Must(Client("share add " + share + " " + folder_.Path(share)));
    }
    const auto push = [&](const std::string& shares, const std::string& user) {
        return Client("push " + shares + " -s 127.0.0.1 --password-file - -u " + user,
                      "secret words\n");
    };
    EXPECT_THAT(push("taken", "mallory"), Ended(0));
    fs::rename(folder_.Path("away"), folder_.Path("gone"));
    EXPECT_THAT(push("taken away docs last", "alice"), Ended(3, "share 'away': "));
    ExpectCopyIsComplete();
    EXPECT_TRUE(fs::exists(storage_ + "/last/file"));
    EXPECT_THAT(push("taken last", "alice"), Ended(4, "'taken': the share belongs to another"));
    EXPECT_THAT(push("away", "alice"), Ended(3, "away"));
    // Nobody there: no share is tried after the first.
    StopServer();
    const test::Outcome unreachable = push("docs last", "alice");
    EXPECT_THAT(unreachable, Ended(1, "refuses connections"));
    EXPECT_THAT(unreachable.output, Not(HasSubstr("last")));
}

TEST_F(PushTest, EachFailureHasItsOwnErrorAndTheNextPushCompletesTheCopy) {
    EXPECT_THAT(Push("", "wrong"), Ended(4, "password"));
    EXPECT_THAT(Client("push docs -s no.such.invalid -u alice --password-file -", "secret words\n"),
                Ended(1, "cannot be looked up"));
    StopServer();
    EXPECT_THAT(Push(), Ended(1, "refuses"));
    StartServer();
    Must(Server("disable"));
    EXPECT_THAT(Push(), Ended(4, "switched off"));
    Must(Server("enable"));
    fs::rename(storage_, storage_ + ".away");
    EXPECT_THAT(Push(), Ended(4, "storage folder is not there"));
    fs::rename(storage_ + ".away", storage_);
    ExpectNextPushCompletes();
}

TEST_F(PushTest, APushThatIsCutOffLosesNothing) {
    ExpectNextPushCompletes();
    fs::remove(source_ + "/a.txt");
    const auto cut_off = [&](const std::string& how) {
        Write("large", RandomBytes(32 << 20));  // nothing of which is there from the last time
        // Slow enough to be caught in the middle.
        const test::Outcome outcome = Push("--bwlimit 4096 -q", "secret words", "alice", how);
        // Deletions come last, and no half file stands under its name.
        EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt")) << how;
        EXPECT_FALSE(fs::exists(storage_ + "/docs/large")) << how;
        EXPECT_THAT(Server("shares").output, HasSubstr("CLIENT-1"));
        return outcome;
    };
    EXPECT_EQ(cut_off("(sleep 1; kill -KILL $$) & ").exit_code, -1);
    // Written in place once there is one.
    const std::string partial = storage_ + "/docs/.tarqrsync-partial/large";
    const auto is_sending = [&] { return !PartOf("large", 1).empty() || fs::exists(partial); };
    EXPECT_TRUE(test::Await([&] { return !is_sending(); }));
    std::thread restart([&] {
        EXPECT_TRUE(test::Await(is_sending));
        StopServer();
        StartServer();
    });
    EXPECT_EQ(cut_off("").exit_code, 1);
    restart.join();
    // An account that is taken out ends with what it does at that moment, even where one of its
    // processes does not hear of it.
    auto push = std::async(std::launch::async, cut_off, "");
    pid_t deaf = 0;
    EXPECT_TRUE(test::Await([&] {
        const fs::path part = PartOf("large", 1);
        deaf = WriterOf(part.empty() ? fs::path(partial) : part);
        return deaf != 0;
    }));
    const bool is_held = ptrace(PTRACE_SEIZE, deaf, nullptr, nullptr) == 0;  // stops at SIGTERM
    Must(Server("account disable alice"));
    EXPECT_EQ(push.wait_for(std::chrono::seconds(60)), std::future_status::ready);
    if (is_held) {
        int status = 0;
        EXPECT_TRUE(test::Await([&] {
            return waitpid(deaf, &status, __WALL | WNOHANG) == deaf && WIFSIGNALED(status);
        }));
        EXPECT_EQ(WTERMSIG(status), SIGKILL);
    }
    EXPECT_NE(push.get().exit_code, 0);
    EXPECT_THAT(Push(), Ended(4, "password"));
    Must(Server("account enable alice"));
    // The server knows that nobody pushes any more, unless it was too busy to be told.
    int tries = 0;
    do {
        EXPECT_THAT(cut_off("(sleep 1; kill -INT $$) & "), Ended(5, "ended by the user"));
    } while (Matches(HasSubstr("being pushed"))(Server("shares").output) && ++tries < 4);
    EXPECT_LT(tries, 4);
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AnUnreadableSourceOrAnotherVolumeNeverLeadsToDeletions) {
    ExpectNextPushCompletes();
    fs::rename(source_, source_ + ".away");
    EXPECT_EQ(Push().exit_code, 3);
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    fs::rename(source_ + ".away", source_);

    // As if the share had been added on a disk that is not mounted now: its folder is there, and
    // empty.
    const std::string catalogue = folder_.Path("client/usr/tarq/etc/tarqshare.conf");
    const std::string good = test::ReadFile(catalogue);
    const std::regex volume("volume=\"/");
    std::ofstream(catalogue) << std::regex_replace(good, volume, "volume=\"/mnt/unplugged-");
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(3, "not mounted where it was"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    std::ofstream(catalogue) << good;
    ExpectNextPushCompletes();
}

TEST_F(PushTest, AFullDiskAtTheServerIsSaidAndThenHealed) {
    if (!PutStorageOnDisk("4m")) {
        GTEST_SKIP() << "needs root to mount a small disk";
    }
    ExpectNextPushCompletes();
    Write("large", std::string(8 << 20, 'x'));
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(1, "full"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    EXPECT_TRUE(PutStorageOnDisk("32m"));
    ExpectNextPushCompletes();

    // Old versions make room.
    const auto push_large = [this](char content, size_t megabytes = 8) {
        Write("large", std::string(megabytes << 20, content));
        return Push();
    };
    const auto has_aged = [](const std::string& version) {
        const fs::path path = version;
        fs::rename(path, path.parent_path() / ("2020" + path.filename().string().substr(4)));
    };
    const auto aged = [this] {
        const auto versions = Versions();
        return std::count_if(versions.begin(), versions.end(), [](const std::string& version) {
            return version.find("/2020") != std::string::npos;
        });
    };
    EXPECT_TRUE(PutStorageOnDisk("36m"));
    Must(push_large('2'));
    Must(push_large('3'));
    has_aged(Versions()[1]);  // 8 MiB of x
    EXPECT_TRUE(test::Await([&] { return push_large('4', 16).exit_code == 0; }));
    EXPECT_EQ(aged(), 0);

    // But nobody's for another one, and none that is young.
    EXPECT_TRUE(PutStorageOnDisk("64m"));
    Must(Server("setup --reserve 15"));
    Must(Server("account add bob --password-file -", "secret words\n"));
    folder_.Write("other/file", "");
    Must(Client("share add other " + folder_.Path("other")));
    for (const char* const content : {"1", "22"}) {
        folder_.Write("other/file", content);
        Must(Client("push other -s 127.0.0.1 --password-file - -u bob", "secret words\n"));
    }
    const std::string of_bob = storage_ + "/.versions/other";
    has_aged(fs::directory_iterator(of_bob)->path());
    has_aged(Versions()[1]);  // 8 MiB of 2
    for (const char content : {'5', '6', '7'}) {
        Must(push_large(content));
    }
    EXPECT_TRUE(test::Await([&] { return aged() == 0; }));
    const auto young = Versions();
    for (int i = 0; i < 2; ++i) {
        EXPECT_THAT(push_large('8', 40), Ended(1, "full"));
    }
    Must(Server("keep-versions --space"));
    EXPECT_THAT(Versions(), IsSupersetOf(young));
    // One file that is larger than all that is free: what failed counts for its account, which
    // owes nothing yet.
    Must(Server("setup --reserve 1"));
    Must(push_large('8', 1));
    has_aged(Versions().back());  // 8 MiB of 7
    const auto free = static_cast<size_t>(fs::space(storage_).available >> 20);
    EXPECT_TRUE(test::Await([&] { return push_large('9', free + 4).exit_code == 0; })) << free;
    EXPECT_THAT(fs::directory_iterator(of_bob)->path().string(), HasSubstr("/2020"));
}

TEST_F(PushTest, AnotherAccountOrClientIsKeptOut) {
    Must(Server("account add mallory --password-file -", "secret words\n"));
    ExpectNextPushCompletes();
    EXPECT_THAT(Push("", "secret words", "mallory"),
                Ended(4, "'docs': the share belongs to another account"));
    for (const std::string user : {"mallory", "alice"}) {  // alice: nothing has been started
        EXPECT_NE(Rsync(source_ + "/a.txt " + user + "@127.0.0.1::docs/forged"), 0);
        EXPECT_FALSE(fs::exists(storage_ + "/docs/forged"));
    }
    // A client with another identity does not get alice's share either, until the admin releases
    // it.
    folder_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"CLIENT-2\"\n");
    EXPECT_EQ(Push().exit_code, 4);
    Must(Server("shares --release docs"));
    ExpectNextPushCompletes();
}

// A local user of the server, who finds files of all modes there.
TEST_F(PushTest, NobodyElseGetsAtTheCopies) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs root to become another user";
    }
    const auto stranger = [&](const std::string& line) {
        return test::RunProgram(
            "", {"setpriv", "--reuid=65534", "--regid=65534", "--clear-groups", "sh", "-c", line});
    };
    for (const std::string name : {"", "server", "client"}) {
        fs::permissions(folder_.Path(name), fs::perms::others_exec | fs::perms::others_read,
                        fs::perm_options::add);
    }
    Write("all", "writable");
    fs::permissions(source_ + "/all", fs::perms::all);
    ExpectNextPushCompletes();
    fs::create_directory(folder_.Path("his"));
    fs::permissions(folder_.Path("his"), fs::perms::all);
    for (const std::string attempt : {"cat", "echo forged >>", "ln -t his",
                                      "setfattr -n user.rsync.%stat -v '104755 0,0 0:0'"}) {
        EXPECT_NE(stranger("cd " + folder_.Path() + "; " + attempt + " " + storage_ + "/docs/all")
                      .exit_code,
                  0)
            << attempt;
    }
    EXPECT_EQ(stranger("find " + folder_.Path("server") + " ! -type d -readable 2>&-").output, "");

    // A folder that was opened, or another in its place, is not used, and closed by a set-up.
    const auto expect_closed_again = [&](const std::string& why) {
        EXPECT_THAT(Server("status"), Ended(1, why));
        EXPECT_THAT(Server("serve"), Ended(2, why));
        EXPECT_THAT(Push(), Ended(4, "open to others"));
    };
    fs::permissions(storage_, fs::perms::others_exec, fs::perm_options::add);
    expect_closed_again("may be entered by others (mode 701)");
    Must(Server("setup"));
    ExpectNextPushCompletes();
    fs::rename(storage_, storage_ + ".away");
    fs::create_symlink(storage_ + ".away", storage_);
    expect_closed_again("is a symbolic link");
    fs::remove(storage_);
    fs::rename(storage_ + ".away", storage_);

    // As an earlier version has left it, beside things of others: those stay as they are.
    fs::create_directory(storage_ + "/www");
    fs::permissions(storage_, fs::perms(0755));
    EXPECT_THAT(Server("setup"), Ended(1, "holds 'www'"));
    EXPECT_EQ(test::ModeOf(storage_), 0755U);
    EXPECT_THAT(Server("setup --storage " + storage_ + "/copies"), Ended(0, "Moved:"));
    EXPECT_THAT(Push(), Ended(0, "0 files sent, 0 deleted"));
    EXPECT_EQ(
        test::RunProgram("", {"diff", "-r", "-x", ".zel_*", source_, storage_ + "/copies/docs"})
            .output,
        "");
}

TEST_F(PushTest, StorageWithoutAttributesMustBeAskedFor) {
    if (mount("ramfs", storage_.c_str(), "ramfs", 0, nullptr) != 0) {
        GTEST_SKIP() << "needs root to mount a disk without attributes";
    }
    EXPECT_THAT(Server("setup"), Ended(1, "keeps no user attributes"));
    EXPECT_EQ(Push().exit_code, 4);
    Must(Server("setup --no-attributes"));
    chmod((source_ + "/a.txt").c_str(), 06755);
    ExpectNextPushCompletes();
    EXPECT_EQ(test::ModeOf(storage_ + "/docs/a.txt"), 0755U);
    EXPECT_THAT(Push(), Ended(0, "0 files sent, 0 deleted"));
}

TEST_F(PushTest, AModuleIsForOneAccountOneUseAndAWhile) {
    Must(Server("account add mallory --password-file -", "secret words\n"));
    ExpectNextPushCompletes();
    const std::string source = " " + source_ + "/ ";
    const auto forge = [&](const std::string& options, const std::string& place) {
        const int ended = Rsync(options + source + place + "/forged");
        EXPECT_FALSE(fs::exists(storage_ + "/docs/forged")) << options;
        return ended;
    };
    // What the daemon's rsync takes for the value of an option is one for its exec, too.
    EXPECT_NE(forge("-r -M--suffix -M--sender", "alice@127.0.0.1::docs"), 0);
    EXPECT_EQ(Command("ZEL_SyncStart", "volumeName=\"v\"\nshareName=\"docs\""), "status=\"0\"\n");
    EXPECT_NE(forge("-r", "mallory@127.0.0.1::docs"), 0);
    for (const char* options :
         {"-r -M--suffix -M--sender", "-r --inplace", "-r --append", "-r -b --backup-dir=old",
          "-r -T /tmp", "-r --partial-dir=/tmp/x", "-r -M--log-file=/tmp/x", "-r -s", "-rK"}) {
        EXPECT_NE(forge(options, "alice@127.0.0.1::docs"), 0) << options;
    }
    Write("late", "l");
    EXPECT_EQ(Rsync("-rlptgoD --modify-window=-1 --whole-file" + Kept('1') + source +
                    "alice@127.0.0.1::docs"),
              0);
    ExpectCopyIsComplete();

    // Whoever began that push is never heard of again.
    const std::string open = folder_.Path("server/var/run/zel_server/.open/docs.conf");
    const auto is_quiet = [&] {  // the daemon has noticed that the transfer is over
        return std::distance(fs::directory_iterator(fs::path(open).parent_path()), {}) == 1;
    };
    EXPECT_TRUE(test::Await(is_quiet));
    EXPECT_THAT(Server("shares"), Ended(0));  // waits for whoever changes the registry
    fs::last_write_time(open, fs::file_time_type::clock::now() - std::chrono::minutes(11));
    EXPECT_THAT(Server("shares"), Ended(0, "not complete"));
    EXPECT_EQ(Command("ZEL_UpdateTaskStatus", "taskName=\"t\""), "status=\"0\"\n");
    EXPECT_FALSE(fs::exists(open));
    EXPECT_NE(forge("-r", "alice@127.0.0.1::docs"), 0);

    const auto module = [&](const std::string& access) {
        const std::string answer = Command(
            "ZEL_OpenShare", "shareName=\"docs\"\noutfile=\"x\"\naccess=\"" + access + "\"");
        const std::regex line("status=\"0\"\nmodule=\"([.][0-9a-f]{32})\"\n");
        std::smatch found;
        EXPECT_TRUE(std::regex_match(answer, found, line)) << answer;
        return "127.0.0.1::" + found[1].str();
    };
    const std::string reading = module("read");
    EXPECT_THAT(Server("shares --open docs"), Ended(0, "alice@" + reading + "/ FOLDER/"));
    EXPECT_EQ(Rsync("-aAX --numeric-ids alice@" + reading + "/ " + folder_.Path("restored")), 0);
    EXPECT_EQ(test::RunProgram("", {"diff", "-r", source_, folder_.Path("restored")}).output, "");
    EXPECT_NE(Rsync("-r mallory@" + reading + "/ " + folder_.Path("stolen")), 0);
    EXPECT_NE(forge("-r", "alice@" + reading), 0);
    const std::string comparing = "alice@" + module("compare");
    EXPECT_EQ(Rsync("-rn --delete-after" + source + comparing), 0);
    EXPECT_NE(forge("-r", comparing), 0);
    EXPECT_NE(Rsync("-r " + comparing + "/ " + folder_.Path("stolen")), 0);
}

TEST_F(PushTest, WhatAPushReplacesOrDeletesIsKept) {
    Write("turned", "a file");
    Write("closed/deep/c", "c");
    chmod((source_ + "/closed/deep").c_str(), 0);
    fs::create_symlink("a.txt", source_ + "/link");
    EXPECT_THAT(Push(), Ended(0));
    EXPECT_THAT(Push(), Ended(0, "0 files sent, 0 deleted"));
    EXPECT_FALSE(fs::exists(storage_ + "/.versions"));

    const auto before = Everything();
    Write("a.txt", "alpha 2");
    fs::remove(source_ + "/turned");
    Write("turned/into", "a folder");
    fs::remove_all(source_ + "/closed");
    fs::remove(source_ + "/link");
    Write(".zel_versions/mine", "of this machine's");
    EXPECT_THAT(Push("--delta"), Ended(0, "2 files sent"));
    EXPECT_FALSE(fs::exists(storage_ + "/docs/.zel_versions/mine"));
    fs::remove_all(source_ + "/.zel_versions");
    ExpectNextPushCompletes();
    std::vector<std::string> versions = Versions();
    ASSERT_EQ(versions.size(), 1U);
    EXPECT_EQ(test::ReadFile(versions[0] + "/a.txt"), "alpha");
    EXPECT_EQ(test::ReadFile(versions[0] + "/turned"), "a file");
    EXPECT_EQ(test::ReadFile(versions[0] + "/closed/deep/c"), "c");
    EXPECT_EQ(test::ReadFile(versions[0] + "/link"), "a.txt");

    // By its path in the share, whatever part of it is pushed.
    Write("sub/b.txt", "beta 2");
    EXPECT_THAT(Push("--path /sub"), Ended(0, "1 file sent"));
    versions = Versions();
    ASSERT_EQ(versions.size(), 2U);
    EXPECT_EQ(test::ReadFile(versions[1] + "/sub/b.txt"), "beta");
    // Each is the file itself, not a copy of it.
    const auto after = Everything();
    for (const auto& [inode, content] : before) {
        EXPECT_TRUE(after.count(inode) != 0 && after.at(inode) == content) << content;
    }
    // Readers see nothing of it.
    EXPECT_THAT(Push("--dry-run"), Ended(0, "0 files (0 B) would be sent, 0 deleted"));
}

double MiBOnTheWire(const test::Outcome& push) {
    std::smatch wire;
    if (!std::regex_search(push.output, wire, std::regex(", ([0-9.]+) ([KM])iB on the wire"))) {
        ADD_FAILURE() << push.output;
        return 0;
    }
    return std::stod(wire[1]) / (wire[2] == "K" ? 1024 : 1);
}

// Cut in every way, new or in the place of another, whole or by its changes.
TEST_F(PushTest, ABrokenUploadGoesOnWhereItStopped) {
    const std::string partials = storage_ + "/docs/.zel_partial";
    ExpectNextPushCompletes();
    // At the server or, by SIGINT, at the client.
    for (const int signal : {SIGKILL, SIGTERM, SIGINT}) {
        SCOPED_TRACE(signal);
        const std::string delta = signal == SIGTERM ? "--delta" : "";
        // The first is new, the others replace what is there.
        const std::string before = test::ReadFile(storage_ + "/docs/sub/.a large");
        Write("sub/.a large", RandomBytes(16 << 20));
        auto broken = std::async(std::launch::async, [&] {
            return Push("--bwlimit 8192 " + delta, "secret words", "alice",
                        signal == SIGINT ? "(until find '" + partials +
                                               "' -size +10M | grep -q .; do sleep 0.1; done; "
                                               "kill -INT $$) & "
                                         : "");
        });
        if (signal != SIGINT) {
            fs::path part;
            ASSERT_TRUE(
                test::Await([&] { return !(part = PartOf(".a large", 10 << 20)).empty(); }));
            kill(-getpgid(WriterOf(part)), signal);
        }
        EXPECT_NE(broken.get().exit_code, 0);
        EXPECT_EQ(test::ReadFile(storage_ + "/docs/sub/.a large"), before);

        const test::Outcome next = Push(delta);
        EXPECT_THAT(next, Ended(0, "1 file sent"));
        EXPECT_LT(MiBOnTheWire(next), 8);
        ExpectCopyIsComplete();
        EXPECT_TRUE(test::Await([&] { return fs::is_empty(partials); }));
        EXPECT_FALSE(fs::exists(storage_ + "/docs/sub/.tarqrsync-partial"));
        EXPECT_EQ(before.empty() || test::ReadFile(Versions().back() + "/sub/.a large") == before,
                  true);
    }
}

// With the account's password and an rsync of their own.
TEST_F(PushTest, WhoeverMayWriteCanLoseNothing) {
    Write("closed/deep/c", "c");
    chmod((source_ + "/closed").c_str(), 0);
    ExpectNextPushCompletes();
    Write("a.txt", "alpha 2");
    ExpectNextPushCompletes();
    ASSERT_EQ(Versions().size(), 1U);

    const std::string evil = folder_.Path("evil");
    auto before = Everything();
    const auto is_kept = [&before, this](const std::string& attack) {
        Versions();
        const auto after = Everything();
        for (const auto& [inode, content] : before) {
            EXPECT_TRUE(after.count(inode) != 0 && after.at(inode) == content)
                << content << " is lost by " << attack;
        }
    };
    const auto attack = [&](char digit, const std::string& options) {
        EXPECT_EQ(Command("ZEL_SyncStart", "volumeName=\"v\"\nshareName=\"docs\""),
                  "status=\"0\"\n");
        const int ended =
            Rsync(options + Kept(digit) + evil + "/ alice@127.0.0.1::docs 2>/dev/null");
        is_kept(options);
        return ended;
    };
    const std::string own = ".zel_versions/" + std::string(32, '1');
    const std::string others = ".zel_versions/" + std::string(32, '2');
    // In the place of what the run itself is just keeping, and of what another does.
    for (const std::string& place : {own, others}) {
        folder_.Write("evil/" + place + "/a.txt", "forged");
        folder_.Write("evil/" + place + "/sub", "a file instead of a folder");
    }
    folder_.Write("evil/a.txt", "forged");
    folder_.Write("evil/closed", "a file instead of a folder");
    fs::create_directories(storage_ + "/docs/" + others);
    fs::rename(storage_ + "/docs/sub", storage_ + "/docs/" + others + "/sub");  // interrupted
    EXPECT_NE(attack('1', "-r --delete-after"), 0);
    fs::remove_all(evil + "/.zel_versions");
    fs::create_symlink("/", evil + "/.zel_versions");
    attack('3', "-rl --delete-after");
    fs::remove(evil + "/.zel_versions");
    folder_.Write("evil/.zel_versions", "a file");
    attack('4', "-r --delete-after");
    fs::remove_all(evil);
    // Of two runs at once one makes a folder of a file, and the other puts into it what the first
    // has to keep, too: below the name of the version.
    before = Everything();
    folder_.Write("evil/slow/a.txt/x", std::string(200000, 'x'));
    folder_.Write("evil/quick/a.txt/x", "forged");
    std::thread slow([&] {
        Rsync("-r --bwlimit=100" + Kept('7') + evil + "/slow/ alice@127.0.0.1::docs 2>/dev/null");
    });
    EXPECT_TRUE(test::Await([this] {
        std::error_code error;
        return fs::directory_iterator(storage_ + "/docs/a.txt", error) != fs::directory_iterator();
    }));
    EXPECT_EQ(Rsync("-r" + Kept('8') + evil + "/quick/ alice@127.0.0.1::docs 2>/dev/null"), 0);
    slow.join();
    is_kept("two runs at once");
    fs::remove_all(evil);
    // rsync writes into what it takes for the part of a broken upload.
    folder_.Write("evil/sub/b.txt", std::string(100000, 'b'));
    fs::create_symlink(".", evil + "/sub/.tarqrsync-partial");
    attack('9', "-rl");
    before = Everything();
    folder_.Write("evil/sub/b.txt", std::string(100000, 'b') + "forged");
    attack('a', "-r --no-whole-file --partial-dir=.tarqrsync-partial");
    fs::remove_all(evil);
    fs::create_directory(evil);
    EXPECT_EQ(attack('5', "-r --delete-after"), 0);
    // Nothing but the server's own folders.
    EXPECT_EQ(std::distance(fs::directory_iterator(storage_ + "/docs"), {}), 2);
    // Whatever is there, from before the name was reserved.
    fs::remove_all(storage_ + "/docs/.zel_versions");
    folder_.Write("server/storage/docs/.zel_versions", "was there before");
    EXPECT_EQ(attack('6', "-r --delete-after"), 0);
    EXPECT_EQ(test::ReadFile(Versions().back() + "/.zel_versions"), "was there before");
}

// Whatever a client makes rsync do, which has the guard loaded.
TEST(VersionsGuard, KeepsWhatIsThereAndHindersNothingElse) {
    const test::TempFolder folder;
    const std::string script = R"(
import errno, os, sys
os.chdir(sys.argv[1])
os.makedirs('.zel_versions/1/sub')
os.makedirs('sub/.zel_versions')
def write(path, text):
    with open(path, 'w') as file: file.write(text)
for path in ('a', 'b', 'c', 'sub/.zel_versions/a', '.zel_versions/1/a', '.zel_versions/1/sub/a'): write(path, path)
def refused(do, *paths, **where):
    try: do(*paths, **where)
    except OSError as problem: assert problem.errno == errno.EPERM, (paths, problem)
    else: assert False, paths
kept = os.open('.zel_versions/1', os.O_RDONLY)
refused(os.rename, 'a', '.zel_versions/1/a')
refused(os.rename, 'a', 'a', dst_dir_fd=kept)
refused(os.rename, 'a', 'sub/../.zel_versions/1/sub/a')
refused(os.rename, '.zel_versions/1/a', 'd')
refused(os.rename, '.zel_versions/1/sub', 'd')
refused(os.rename, '.zel_versions', 'd')
refused(os.unlink, os.getcwd() + '/.zel_versions/1/a')
refused(os.unlink, 'a', dir_fd=kept)
os.mkdir('.zel_versions/empty')
refused(os.rmdir, '.zel_versions/empty/')
os.rename('a', '.zel_versions/1/new')
os.link('b', '.zel_versions/1/b')
os.rename('c', 'b')
os.unlink('b')
os.unlink('sub/.zel_versions/a')
os.rmdir('sub/.zel_versions')
os.rmdir('sub')
for do in (os.unlink, os.rmdir):
    try: do('.zel_versions/1/none')
    except FileNotFoundError: pass
    else: assert False
assert 'LD_PRELOAD' not in os.popen('env').read()
)";
    const test::Outcome outcome = test::RunProgram(
        "", {"env", "LD_PRELOAD=" ZEL_VERSIONS_GUARD, "RSYNC_MODULE_PATH=" + folder.Path(""),
             "python3", "-c", script, folder.Path("")});
    EXPECT_THAT(outcome, Ended(0));
    EXPECT_EQ(test::ReadFile(folder.Path(".zel_versions/1/a")), ".zel_versions/1/a");
    EXPECT_EQ(test::ReadFile(folder.Path(".zel_versions/1/b")), "b");
}

TEST_F(PushTest, AnAdminsModuleIsNeverAnAccounts) {
    folder_.Write("admins/passwd", "root");
    folder_.Write("server/usr/tarq/etc/zel_server/admin.d/sys.conf",
                  "[docs]\n    path = " + folder_.Path("admins") + "\n    read only = no\n");
    EXPECT_THAT(Server("setup"), Ended(0, "are served no more"));
    ExpectNextPushCompletes();
    EXPECT_EQ(std::distance(fs::directory_iterator(folder_.Path("admins")), {}), 1);
    EXPECT_THAT(Server("status"), Ended(0));
}

TEST_F(PushTest, CommandsOfMischiefChangeNothing) {
    ExpectNextPushCompletes();
    const std::string registry = folder_.Path("server/usr/tarq/etc/tarqZEL.info");
    const std::string before = test::ReadFile(registry);
    const std::string head = "session=\"" + kSession + "\"\n";
    const std::string start =
        head + "command=\"ZEL_SyncStart\"\nclientID=\"CLIENT-1\"\nvolumeName=\"v\"\n";
    const std::pair<std::string, std::string> cases[] = {
        {start + "shareName=\"../../etc\"\n", "status=\"201\"\n"},
        {start + "shareName=\"x\"\ncommand=\"ZEL_Pairing\"\n", "status=\"201\"\n"},
        {head + "command=\"ZEL_Pairing\"\nclientID=\"C\"\nserverName=\"x\ndryRun=\"no\"\"\n",
         "status=\"201\"\n"},
        {start + "shareName=\"x\"\n" + std::string(4800, '#'), "status=\"201\"\n"},
        {std::string(5000, '\xff'), ""},
        {"", ""},
    };
    for (const auto& [text, answer] : cases) {
        EXPECT_EQ(Ask(text), answer) << text.substr(0, 200);
    }
    EXPECT_EQ(test::ReadFile(registry), before);
    // Answers do not pile up.
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
    EXPECT_TRUE(fs::is_empty(folder_.Path("server/var/run/zel_server/alice")));
}

TEST_F(PushTest, StatusNamesWhatKeepsPushesOut) {
    EXPECT_THAT(Server("status --json"), Ended(0, "\"pushes_can_succeed\": true"));
    const auto expect = [&](const std::string& what, const std::string& mend) {
        EXPECT_THAT(Server("status"),
                    AllOf(Ended(1, what), Field(&test::Outcome::output, HasSubstr(mend))));
        EXPECT_NE(Push().exit_code, 0) << what;
    };
    Must(Server("disable"));
    Must(Server("setup"));  // leaves the switch, and all else, as it is
    expect("switched off", "zel_server enable");
    Must(Server("enable"));
    fs::rename(storage_, storage_ + ".away");
    expect("is not there", "mount its disk");
    fs::rename(storage_ + ".away", storage_);
    if (PutStorageOnDisk("4M")) {
        ASSERT_EQ(mount("", storage_.c_str(), "", MS_REMOUNT | MS_RDONLY, nullptr), 0);
        expect("mounted read-only", "remount,rw");
        umount2(storage_.c_str(), MNT_DETACH);
        expect("not on the disk mounted at", "run 'zel_server setup' again");
        SetUpServer();
    }
    fs::permissions(folder_.Path("server/usr/tarq/etc/zel_server/rsyncd.secrets"),
                    fs::perms::others_read, fs::perm_options::add);
    expect("open to others", "chmod 600");
    Must(Server("account rm alice"));
    expect("no account may log in", "zel_server account add");
    Must(Server("account add alice --password-file -", "secret words\n"));
    EXPECT_THAT(Server("account add alice --password-file -", "secret words\n"),
                Ended(0, "was there already"));
    ExpectNextPushCompletes();
    fs::remove_all(storage_ + "/docs");
    EXPECT_THAT(Server("status"), Ended(0, "no copy of 'docs' any more"));
    for (const char* folder : {".open", ".configs"}) {
        fs::remove_all(folder_.Path("server/var/run/zel_server/") + folder);
        ExpectNextPushCompletes();
    }
    fs::remove(folder_.Path("server/usr/tarq/etc/zel_server/rsyncd.conf"));
    expect("rsyncd.conf is not there", "zel_server setup");
    Must(Server("setup"));
    ExpectNextPushCompletes();

    StopServer();
    expect("the rsync daemon is not running", "zel_server serve");
    test::ServerProcess other;
    other.Start({"python3", "-m", "http.server", std::to_string(port_), "--bind", "127.0.0.1"},
                folder_.Path("other.log"), port_);
    expect("held by python3, process ", "choose another port");
    EXPECT_THAT(Server("setup --address 127.0.0.1 --storage " + folder_.Path("new") +
                       " --plain-port " + std::to_string(port_)),
                Ended(1, "held by python3, process "));
    EXPECT_FALSE(fs::exists(folder_.Path("new")));
    // A set-up that could not be finished is begun anew.
    other.Stop();
    StopServer();
    const auto fresh = [&](const std::string& more) {
        return test::RunProgram(
            folder_.Path("fresh"),
            {"sh", "-c",
             "exec " ZEL_SERVER " setup --storage " + folder_.Path("new") + " --plain-port " +
                 std::to_string(port_) + " --port " + std::to_string(tls_port_) + more});
    };
    EXPECT_THAT(fresh(" --volume v=/proc/none"), Ended(1, "cannot make the storage folder"));
    EXPECT_THAT(fresh(""), Ended(0, "zel_server serve"));
}

TEST_F(PushTest, ARegistryThatWasCutIsMendedByTheCommandThatStatusNames) {
    ExpectNextPushCompletes();
    const std::string registry = folder_.Path("server/usr/tarq/etc/tarqZEL.info");
    for (const uintmax_t size : {fs::file_size(registry) / 2, uintmax_t{0}}) {
        fs::resize_file(registry, size);
        EXPECT_THAT(Server("status"), Ended(1, "zel_server repair"));
        EXPECT_EQ(Push().exit_code, 4);
        Must(Server("repair"));
        EXPECT_THAT(Server("status"), Ended(0));
        EXPECT_THAT(Server("shares"), Ended(0, "CLIENT-1"));
        ExpectNextPushCompletes();
    }
}

TEST_F(PushTest, FilesOfWhichNothingIsRecordedAreNobodysUntilTheyAreAdopted) {
    ExpectNextPushCompletes();
    EXPECT_THAT(Server("shares --json"), Ended(0, "\"generation\": 1,"));
    const std::string etc = folder_.Path("server/usr/tarq/etc");
    fs::remove_all(etc + "/zel_server/shares");
    fs::remove(etc + "/tarqZEL.info");
    Must(Server("enable"));
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push(), Ended(4, "no record of whose they are"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));

    EXPECT_THAT(Server("shares --adopt " + source_), Ended(1, "straight in a storage folder"));
    EXPECT_THAT(Server("shares --adopt " + storage_ + "/docs --account no"),
                Ended(1, "there is no account 'no'"));
    Must(Server("account add mallory --password-file -", "secret words\n"));
    Must(Server("shares --adopt " + storage_ + "/docs --account alice"));
    EXPECT_THAT(Server("shares --adopt " + storage_ + "/docs"), Ended(1, "a share of that name"));
    EXPECT_THAT(Push("", "secret words", "mallory"), Ended(4, "belongs to another account"));
    ExpectNextPushCompletes();
}

TEST_F(PushTest, ACopyThatIsNotTheOneThatWasLeftIsComparedWholeOrWaitsForAPerson) {
    ExpectNextPushCompletes();
    // A clone: the same identity and account, and what was known at that time.
    fs::copy(folder_.Path("client"), folder_.Path("clone"), fs::copy_options::recursive);
    const auto clone = [&](const std::string& arguments) {
        return test::Zelctl(folder_.Path("clone"), arguments, "secret words\n");
    };
    const std::string push = "push docs -s 127.0.0.1 --password-file - -u alice";
    Write("new", "n");
    ExpectNextPushCompletes();
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(clone(push), Ended(4, "changed by another machine since this one last pushed it"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/a.txt"));
    // The other one has lost nothing by it, whatever became of its pushes.
    EXPECT_EQ(
        Push("--bwlimit 1 -q", "secret words", "alice", "(sleep 0.3; kill -KILL $$) & ").exit_code,
        -1);
    ExpectNextPushCompletes();
    EXPECT_THAT(clone("share confirm docs"), Ended(2, "nobody to ask"));
    EXPECT_THAT(clone("share confirm docs --yes"), Ended(0, "compares all of share 'docs'"));
    EXPECT_THAT(clone(push), Ended(0));
    EXPECT_THAT(Push(), Ended(4, "changed by another machine"));
    Must(Client("share confirm docs --yes"));
    ExpectNextPushCompletes();
    EXPECT_THAT(Push("--path /sub"), Ended(0));

    // A server that was put back to an older state goes on.
    const std::string record = folder_.Path("server/usr/tarq/etc/zel_server/shares/docs");
    const std::string old = test::ReadFile(record);
    ExpectNextPushCompletes();
    std::ofstream(record) << old;
    ExpectNextPushCompletes();
}

TEST_F(PushTest, WhatWasMountedBelowAShareIsNotDeletedWhileItIsAway) {
    const std::string disk = source_ + "/sub/[a] disk\\*";
    fs::create_directories(disk);
    if (mount("tmpfs", disk.c_str(), "tmpfs", 0, "size=1m") != 0) {
        GTEST_SKIP() << "needs root to mount a disk";
    }
    Write("sub/[a] disk\\*/file", "on the disk");
    ExpectNextPushCompletes();
    const std::string copied = storage_ + "/docs/sub/[a] disk\\*/file";
    umount2(disk.c_str(), 0);
    Write("new", "n");
    fs::remove(source_ + "/a.txt");
    EXPECT_THAT(Push("--dry-run").output, Not(HasSubstr("delete  sub")));
    EXPECT_THAT(Push(), Ended(3, "is not mounted, as it was before"));
    EXPECT_TRUE(fs::exists(storage_ + "/docs/new"));
    EXPECT_FALSE(fs::exists(storage_ + "/docs/a.txt"));
    EXPECT_THAT(Push("--path /sub"), Ended(3, "is not mounted"));
    EXPECT_THAT(Push("--exclude /sub"), Ended(0));
    fs::remove(disk);  // the mount point too
    EXPECT_THAT(Push(), Ended(3, "is not mounted"));
    EXPECT_TRUE(fs::exists(copied));
    EXPECT_THAT(Client("share confirm docs"), Ended(2, "gone for good"));
    EXPECT_TRUE(fs::exists(copied));
    Must(Client("share confirm docs --yes"));
    ExpectNextPushCompletes();
    EXPECT_FALSE(fs::exists(copied));
}

TEST_F(PushTest, SshReachesTheSameServer) {
    if (!test::SshServer::Available()) {
        GTEST_SKIP() << "this machine cannot run an ssh server for the test";
    }
    test::SshServer ssh;
    const std::string user = ssh.User();
    Must(Server("account add " + user + " --password-file -", "secret words\n"));
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\nssh_options=\"-i " +
              ssh.ClientKey() + "\"\n");
    // Whatever address the daemon was given, ssh arrives at the loopback address.
    StopServer();
    SetUpServer("127.0.0.2");
    StartServer();
    // The one daemon may answer before the other.
    for (int i = 0; i < 100 && Server("status").exit_code != 0; ++i) {
        std::this_thread::sleep_for(std::chrono::milliseconds(100));
    }
    EXPECT_THAT(Server("status"), Ended(0, "of 127.0.0.2"));
    // No host key is taken unseen; one that was confirmed holds for all that follows.
    const std::string to_ssh = "--ssh --ssh-port " + std::to_string(ssh.Port());
    const test::Outcome asked = Push(to_ssh, "secret words", user);
    EXPECT_THAT(asked, Ended(2, "nobody to ask"));
    ExpectNextPushCompletes(to_ssh + " --fingerprint " + KeyIn(asked.output), user);
    EXPECT_THAT(ssh.Log(), HasSubstr("Accepted publickey"));
    ExpectNextPushCompletes("", user);
    EXPECT_THAT(Push("--no-ssh"), Ended(2, "is reached in another way: ssh, port"));
}

TEST_F(PushTest, ARunGoesOnWithAnotherLimitWhenItsWindowEnds) {
    Write("large", RandomBytes(24 << 20));
    // A zone in which a minute ends in a few seconds.
    const time_t now = time(nullptr);
    const time_t behind = (now - 55) % 60;
    const auto at = [&](time_t moment) {
        char text[8];
        const time_t shown = moment - behind;
        strftime(text, sizeof text, "%H:%M", gmtime(&shown));
        return std::string(text);
    };
    const std::string windows = at(now) + "-" + at(now + 60) + "=1M,else=0";
    const auto begin = std::chrono::steady_clock::now();
    const test::Outcome pushed = Push("--bwlimit " + windows, "secret words", "alice",
                                      "TZ=XYZ0:00:" + std::to_string(behind) + " ");
    EXPECT_THAT(pushed, Ended(0));
    const auto took = std::chrono::steady_clock::now() - begin;
    EXPECT_GE(took, std::chrono::seconds(2)) << windows;
    EXPECT_LE(took, std::chrono::seconds(20)) << "24 s at the first limit";
    // What the server had of the file did not travel again; the run that was ended tells no bytes.
    EXPECT_LT(MiBOnTheWire(pushed), 23);
    ExpectCopyIsComplete();
    EXPECT_THAT(Push("--bwlimit 08:00-18:00=1,09:00-10:00=2"), Ended(2, "two windows have 09:00"));
}

TEST_F(PushTest, AServerIsTrustedOnceByItsKeyAndThenReachedInNoOtherWay) {
    const std::string host = "127.0.0.1:" + std::to_string(tls_port_);
    const std::string key = KeyIn(Server("status").output);
    const std::string other = "SHA256:" + std::string(43, 'A');
    Configure("[rsync]\nport=\"1\"\n");  // nothing answers there
    EXPECT_THAT(Client("trust " + host),
                Ended(2, "then: zelctl trust " + host + " --fingerprint " + key));
    EXPECT_THAT(Client("trust " + host + " --fingerprint " + other), Ended(4, "in between"));
    EXPECT_THAT(AtTerminal("trust " + host, "n"), Ended(5, key));
    EXPECT_THAT(Client("trust --list --json"), Ended(0, "[]"));
    EXPECT_THAT(AtTerminal("trust " + host, "y"), Ended(0, "TLS, port"));
    EXPECT_THAT(Client("trust --list"), Ended(0, key));
    ExpectNextPushCompletes();
    EXPECT_THAT(Push("--plain"), Ended(2, "is reached in another way: TLS"));
    EXPECT_THAT(Push("--fingerprint " + other), Ended(2, "To change that: zelctl trust"));

    // Another key than the trusted one: as if the server had changed.
    const std::string path = folder_.Path("client/usr/tarq/etc/tarqrsync_servers");
    std::string text = test::ReadFile(path);
    text.replace(text.find(key), key.size(), other);
    std::ofstream(path) << text;
    EXPECT_THAT(Push(), Ended(4, "key is not the one that was trusted"));
    EXPECT_THAT(AtTerminal("trust " + host, "y"), Ended(0, other));
    ExpectNextPushCompletes();

    // Another name for the same machine is another server; over a network plain must be asked for.
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
    EXPECT_THAT(Client("push docs -s 0.0.0.0 -u alice --password-file -", "secret words\n"),
                Ended(1, "zelctl trust 0.0.0.0 --plain"));
    EXPECT_THAT(Client("push docs -s 0.0.0.0 -u alice --password-file - --plain", "secret words\n"),
                Ended(0, "unprotected"));
    EXPECT_THAT(Client("trust --forget 0.0.0.0"), Ended(0));
    EXPECT_THAT(Client("trust --forget 0.0.0.0"), Ended(2, "no trusted server"));
}

}  // namespace

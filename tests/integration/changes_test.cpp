// Changes that go to a server as a list, in every form that servers take: what was named is there
// as it is here, and nothing else is touched.
#include <sys/stat.h>

#include <sstream>

#include "programs/common/task_run.h"
#include "programs/common/task_settings.h"
#include "tests/integration/client_and_server.h"
#include "tests/support/testing.h"

using namespace testing;

namespace {

using Paths = std::vector<std::string>;

class ChangesTest : public testing::Test, public test::ClientAndServer {
protected:
    ChangesTest() {
        setenv("TARQ_ROOT", folder_.Path("client").c_str(), 1);
        info_.SetServerIP("127.0.0.1");
        info_.SetUser("alice");
        info_.SetPassword("secret words");
        run_ = std::make_unique<programs::TaskRun>(info_, cancel_);
    }
    ~ChangesTest() override { unsetenv("TARQ_ROOT"); }

    programs::RunResult Push(const Paths& paths = {"/"}, bool announce = true) {
        programs::RunOrder order;
        order.task = "t";
        order.announce = announce;
        order.shares = {{"docs", paths}};
        order.excludes = {"/excluded", "*.tmp"};
        programs::RunResult result;
        totals_ = {};
        result = run_->Push(order, totals_);
        return result;
    }
    static std::string FailureOf(const programs::RunResult& result) {
        return result.failure ? result.failure->what() : "";
    }
    /// Every copy of the client goes through a script, which has its list as $list.
    void PutBeforeRsync(const std::string& script) const {
        const std::string program = folder_.Write(
            "rsync",
            "#!/bin/sh\nlist=/dev/null\nfor word in \"$@\"; do case $word in "
            "--files-from=*) list=${word#*=};; --temp-dir=*) copies=yes;; esac; done\n"
            "if [ \"$copies\" ]; then :\n" +
                script + "\nfi\nexec rsync \"$@\"\n");
        chmod(program.c_str(), 0755);
        Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\nrsync=\"" + program + "\"\n");
    }
    std::string In(const std::string& name) const { return source_ + "/" + name; }
    std::string Copy(const std::string& name) const { return storage_ + "/docs/" + name; }

    /// Kind, content and time of every entry but the service's own; the server keeps links in
    /// files.
    static std::map<std::string, std::string> TreeOf(const std::string& folder) {
        std::map<std::string, std::string> tree;
        const auto add = [&](const fs::path& path) {
            struct stat info = {};
            lstat(path.c_str(), &info);
            tree[path.string().substr(folder.size())] =
                (S_ISLNK(info.st_mode)   ? fs::read_symlink(path).string()
                 : S_ISDIR(info.st_mode) ? std::string("/")
                                         : test::ReadFile(path)) +
                " " + std::to_string(info.st_mtim.tv_sec) + "." +
                std::to_string(info.st_mtim.tv_nsec);
        };
        add(folder);
        for (fs::recursive_directory_iterator at(folder), end; at != end; ++at) {
            const std::string name = at->path().filename();
            if (name == ".zel_versions" || name == ".zel_partial") {
                at.disable_recursion_pending();
            } else {
                add(at->path());
            }
        }
        return tree;
    }
    void ExpectEqual() const { EXPECT_EQ(TreeOf(storage_ + "/docs"), TreeOf(source_)); }

    ZEL::SyncInfo info_;
    std::atomic<bool> cancel_{false};
    std::unique_ptr<programs::TaskRun> run_;
    programs::RunTotals totals_;
};

TEST_F(ChangesTest, AListIsExactInEveryForm) {
    // As rsync says it whose receiver takes no such entries, and as servers of earlier versions do.
    const struct {
        const char* script;
        uint64_t runs;
    } forms[] = {
        {"", 2},  // two where this machine's rsync is one that takes no names of what is gone
        {"case \"$*\" in *--delete-missing-args*) echo 'invalid file mode 00 for x [Receiver]' "
         ">&2; "
         "exit 2;; esac",
         2},
        {"case \"$*\" in *--delete-missing-args* | *--no-recursive*) echo \"Refused: rsync's "
         "argument '--delete-missing-args' is none\" >&2; exit 4;; esac",
         1},
    };
    for (const auto& form : forms) {
        PutBeforeRsync("");
        run_ = std::make_unique<programs::TaskRun>(info_, cancel_);
        for (const auto& entry : fs::directory_iterator(source_)) {
            fs::remove_all(entry);
        }
        const Paths odd = {"#hash",    "; semicolon",       "-dash",   " blank ", "line\nbreak",
                           "gl*b[a]?", "back\\slash\\#012", "\xff\xfe"};
        for (const std::string& name : odd) {
            Write("odd/" + name, "1");
            Write(name, "1");
        }
        for (const char* name :
             {"keep/deep/f", "keep/deep/other", "gone/from/x/y", "gone/from/file",
              "was/folder/sub/f", "was/file", "was/linked/f", "tree/one/f", "tree/two/f",
              "emptied/f", "globxba", "touched/f", "excluded/f", "gone/from/x.tmp", "same.tmp"}) {
            Write(name, "1");
        }
        fs::create_symlink("keep", In("was/link"));
        ASSERT_EQ(FailureOf(Push()), "");
        // What the copy has of its own shows where a run has looked.
        std::ofstream(Copy("keep/deep/extra")) << "e";
        fs::create_directories(Copy("keep/more"));
        std::ofstream(Copy("keep/more/extra")) << "e";
        std::ofstream(Copy("tree/two/extra")) << "e";
        std::ofstream(Copy("same.tmp")) << "as it was";
        fs::create_directories(Copy("gone/from"));
        std::ofstream(Copy("gone/from/x.tmp")) << "as it was";

        Paths changed;
        for (const std::string& name : odd) {
            Write("odd/" + name, "22");
            changed.push_back("/odd/" + name);
            fs::remove(In(name));
        }
        Write("keep/deep/f", "22");
        fs::remove_all(In("gone/from/x"));
        fs::remove(In("gone/from/file"));
        fs::remove_all(In("was/folder"));
        Write("was/folder", "a file");
        fs::remove(In("was/file"));
        Write("was/file/f", "a folder");
        fs::remove(In("was/link"));
        Write("was/link/f", "a folder");
        fs::remove_all(In("was/linked"));
        fs::create_symlink("/nowhere", In("was/linked"));
        fs::remove(In("tree/one/f"));
        fs::remove(In("emptied/f"));
        fs::create_directories(In("new/empty"));
        Write("excluded/f", "22");
        Write("excluded/new/f", "22");
        Write("new.tmp", "22");
        fs::remove(In("gone/from/x.tmp"));
        fs::last_write_time(In("touched"), fs::file_time_type(std::chrono::hours(1)));
        for (const char* path :
             {"/keep/deep/f",     "/gone/from/x/y",    "/gone/from/file", "/gone/from/never/was",
              "/gone/from/x.tmp", "/was/folder/sub/f", "/was/file",       "/was/link",
              "/was/linked",      "/was/linked/f",     "/tree",           "/tree/one/f",
              "/emptied/f",       "/new/empty",        "/touched",        "/excluded/f",
              "/excluded/new/f",  "/new.tmp",          "/same.tmp",       "/.zel_versions/x"}) {
            changed.push_back(path);
        }
        PutBeforeRsync(form.script);
        EXPECT_EQ(FailureOf(Push(changed)), "") << form.script;
        EXPECT_LE(totals_.rsync_runs, form.runs) << form.script;

        // What was not named is as it was, here and there.
        auto copy = TreeOf(storage_ + "/docs");
        auto source = TreeOf(source_);
        for (const char* extra : {"/keep/deep/extra", "/keep/more/extra"}) {
            EXPECT_EQ(copy.erase(extra), 1u) << form.script << extra;
        }
        EXPECT_THAT(copy["/gone/from/x.tmp"] + copy["/same.tmp"], HasSubstr("as it was"));
        for (const char* other :
             {"/keep", "/keep/deep", "/keep/more", "/excluded", "/excluded/f", "/excluded/new",
              "/excluded/new/f", "/new.tmp", "/same.tmp", "/gone/from/x.tmp", "/globxba", ""}) {
            copy.erase(other);
            source.erase(other);
        }
        for (const std::string& name : odd) {
            EXPECT_EQ(copy.erase("/" + name), 1u) << "not named, and deleted: " << name;
        }
        EXPECT_EQ(copy, source) << form.script;
        // Named, it goes.
        Paths rest;
        for (const std::string& name : odd) {
            rest.push_back("/" + name);
        }
        EXPECT_EQ(FailureOf(Push(rest)), "");
        for (const std::string& name : odd) {
            EXPECT_FALSE(fs::exists(Copy(name))) << name;
        }
        EXPECT_EQ(TreeOf(storage_ + "/docs")[""], TreeOf(source_)[""]);
        fs::remove_all(storage_ + "/docs/excluded");
        fs::remove(In("same.tmp"));
    }
}

// One path that cannot be read is owed; what is gone elsewhere is deleted all the same.
TEST_F(ChangesTest, WhatCannotBeReadHoldsUpNothingElse) {
    for (const char* name : {"bad/f", "bad/gone", "good/f", "good/gone", "more/gone"}) {
        Write(name, "1");
    }
    ASSERT_EQ(FailureOf(Push()), "");
    for (const char* name : {"bad/gone", "good/gone", "more/gone"}) {
        fs::remove(In(name));
    }
    Write("good/f", "22");
    // rsync deletes nothing in folders then.
    PutBeforeRsync(
        "if tr '\\0' '\\n' <\"$list\" | grep -q /bad; then for word in \"$@\"; do shift; "
        "[ \"$word\" = --delete-after ] || set -- \"$@\" \"$word\"; done\nrsync \"$@\" || exit\n"
        "echo 'rsync: [sender] opendir \"" +
        In("bad/deep") + "\" failed: Permission denied (13)' >&2; exit 23; fi");
    const programs::RunResult result = Push({"/bad", "/good", "/more/gone"});
    ASSERT_EQ(result.undone.size(), 1u);
    EXPECT_EQ(result.undone[0].paths, Paths{"/bad"});
    EXPECT_LE(totals_.rsync_runs, 3u);
    EXPECT_TRUE(fs::exists(Copy("bad/gone")));
    PutBeforeRsync("");
    EXPECT_EQ(FailureOf(Push({"/bad"})), "");
    ExpectEqual();
}

// An unmount has the same effect as the folder that goes while its path stays.
TEST_F(ChangesTest, WhatIsPutInThePlaceOfTheSourceIsNotRead) {
    Write("more/f", "1");
    ASSERT_EQ(FailureOf(Push()), "");
    fs::remove(In("more/f"));
    Write("a.txt", "changed");
    const std::string aside = source_ + ".aside";
    PutBeforeRsync("mv " + source_ + " " + aside + "; mkdir " + source_ +
                   "\nrsync \"$@\"; status=$?; rmdir " + source_ + "; mv " + aside + " " + source_ +
                   "; exit $status");
    const auto before = TreeOf(storage_ + "/docs");
    for (const Paths& paths : {Paths{"/a.txt", "/more/f"}, Paths{"/"}}) {
        EXPECT_EQ(FailureOf(Push(paths)), "");
        ExpectEqual();
    }
    EXPECT_NE(TreeOf(storage_ + "/docs"), before);
}

// ---- A push in one connection, which a server takes that can lock its rsync into the copy ----

class AtOnceTest : public ChangesTest {
protected:
    static constexpr size_t kOrdinary = 3;

    void SetUp() override {
        if (geteuid() != 0) {
            GTEST_SKIP() << "the server's rsync cannot chroot";
        }
        ASSERT_EQ(FailureOf(Push()), "");
    }
    /// How many connections a push of these paths took, as the daemon makes it.
    size_t Connections(const Paths& paths) {
        const size_t before = Connected();
        EXPECT_EQ(FailureOf(Push(paths, false)), "");
        return Connected() - before;
    }
    /// The same of a file that is changed by it.
    size_t ConnectionsOfAChange() {
        Write("a.txt", "change " + std::to_string(++changes_));
        return Connections({"/a.txt"});
    }
    size_t Connected() const {
        const std::string log = test::ReadFile(folder_.Path("server/var/log/rsyncd.log"));
        size_t count = 0;
        for (size_t at = 0; (at = log.find("connect from", at)) != std::string::npos; ++at) {
            ++count;
        }
        return count;
    }
    /// Changes how the server's rsync is configured, from the next connection on.
    void Reconfigure(const std::string& what, const std::string& with) const {
        const std::string name = "server/usr/tarq/etc/zel_server/rsyncd.conf";
        std::string text = test::ReadFile(folder_.Path(name));
        const size_t at = text.find(what, text.find(".zel_push"));
        ASSERT_NE(at, std::string::npos);
        folder_.Write(name, text.replace(at, what.size(), with));
    }
    std::string Notes() const { return folder_.Path("client/usr/tarq/etc/zel_shares/docs"); }
    /// A file that differs at the server and was not named: whoever compares all finds it.
    void SpoilCopy() const {
        std::ofstream(Copy("sub/b.txt")) << "spoilt";
        fs::last_write_time(Copy("sub/b.txt"), fs::file_time_type(std::chrono::hours(2)));
    }
    bool IsSpoilt() const { return test::ReadFile(Copy("sub/b.txt")) == "spoilt"; }

    int changes_ = 0;
};

TEST_F(AtOnceTest, AChangeIsOneConnectionWhoeverPushes) {
    SpoilCopy();
    auto another = std::make_unique<programs::TaskRun>(info_, cancel_);
    another->Connect();
    for (int i = 0; i < 10; ++i) {
        Write("new/" + std::to_string(i), "x");
        EXPECT_EQ(Connections({"/new"}), 1u);
        std::swap(run_, another);
        EXPECT_EQ(ConnectionsOfAChange(), 1u);
    }
    EXPECT_TRUE(IsSpoilt()) << "all was compared";
    EXPECT_EQ(test::ReadFile(Copy("a.txt")), "change 10");
    EXPECT_THAT(test::RunProgram("", {"find", storage_ + "/.versions", "-name", "a.txt"}).output,
                HasSubstr("a.txt"));
    // The end of one may take its time: the next waits for it, in either way.
    Reconfigure("post-xfer exec = ", "post-xfer exec = sleep 1; ");
    EXPECT_EQ(ConnectionsOfAChange(), 1u);
    EXPECT_EQ(ConnectionsOfAChange(), 1u);
    EXPECT_THAT(Client("push docs --server 127.0.0.1 --plain --user alice --password-file -",
                       "secret words\n"),
                test::Ended(0));
    ExpectEqual();
}

TEST_F(AtOnceTest, WhatTheServerDidNotFinishIsComparedWholeAndNothingElse) {
    // The server's end is lost, as in a crash.
    Reconfigure("post-xfer exec = ", "post-xfer exec = exit 0; ");
    EXPECT_EQ(ConnectionsOfAChange(), 1u);
    SpoilCopy();
    EXPECT_EQ(ConnectionsOfAChange(), 1 + kOrdinary);
    ExpectEqual();
    Reconfigure("post-xfer exec = exit 0; ", "post-xfer exec = ");

    // The client does not hear of the end, and goes on in the ordinary way.
    run_ = std::make_unique<programs::TaskRun>(info_, cancel_);
    run_->Connect();
    PutBeforeRsync("case \"$*\" in *--early-input*) rsync \"$@\"; exit 12;; esac");
    SpoilCopy();
    EXPECT_EQ(ConnectionsOfAChange(), 1 + kOrdinary);
    // Nor does it live to note anything.
    const std::string before = test::ReadFile(Notes());
    PutBeforeRsync("");
    EXPECT_EQ(ConnectionsOfAChange(), 1u);
    const std::string mark = test::ReadFile(Notes()).substr(test::ReadFile(Notes()).rfind(' ') + 1);
    std::ofstream(Notes()) << before << "begun=\"" << mark;
    EXPECT_EQ(ConnectionsOfAChange(), 1 + kOrdinary);
    EXPECT_TRUE(IsSpoilt()) << "all was compared";

    // What broke after the server had let it in is this machine's, however long it is away then.
    run_ = std::make_unique<programs::TaskRun>(info_, cancel_);
    run_->Connect();
    for (const char* rsync : {"rsync \"$@\";", "", "", "", "", "", "", "", "", ""}) {
        PutBeforeRsync(std::string("case \"$*\" in *--early-input*) ") + rsync + " exit 10;; esac");
        EXPECT_NE(FailureOf(Push({"/a.txt"}, false)), "");
    }
    PutBeforeRsync("");
    EXPECT_EQ(ConnectionsOfAChange(), 1 + kOrdinary);

    // A server of an earlier version is asked for it once.
    run_ = std::make_unique<programs::TaskRun>(info_, cancel_);
    run_->Connect();
    Reconfigure(".zel_push]", "another]");
    EXPECT_EQ(ConnectionsOfAChange(), 1 + kOrdinary);
    EXPECT_EQ(ConnectionsOfAChange(), kOrdinary);
    EXPECT_TRUE(IsSpoilt());
    // A client that was put back is told so, as ever.
    const std::string old = test::ReadFile(Notes());
    EXPECT_EQ(ConnectionsOfAChange(), kOrdinary);
    std::ofstream(Notes()) << old;
    EXPECT_THAT(FailureOf(Push({"/a.txt"}, false)), HasSubstr("another machine"));
}

// Whoever has an account's password and an rsync of his own gets no further there than his own
// share, in the one form that a push has.
TEST_F(AtOnceTest, NothingElseIsDoneThroughItsModule) {
    Must(Server("account add eve --password-file -", "secret words\n"));
    folder_.Write("bait/bait", "bait");
    chmod(folder_.Write("password", "secret words\n").c_str(), 0600);
    const std::string id(32, 'a');
    // A start as the client would make it now, but for what is `other`.
    const auto write_start = [&](const std::string& client, const std::string& other = "") {
        std::istringstream copy(test::ReadFile(Notes()).substr(sizeof "copy=\"" - 1));
        std::string identity;
        std::string generation;
        std::string mark;
        copy >> identity >> generation >> mark;
        mark.resize(id.size());
        folder_.Write("early", "session=\"" + id + "\"\ncommand=\"ZEL_SyncStart\"\nclientID=\"" +
                                   client + "\"\nvolumeName=\"\"\nshareName=\"docs\"\npush=\"" +
                                   mark + "\"\nexpectedCopy=\"" + identity +
                                   "\"\nexpectedGeneration=\"" + generation +
                                   "\"\nexpectedPush=\"" + (other.empty() ? mark : other) + "\"\n");
    };
    const auto attack = [&](const std::string& options, const std::string& paths,
                            const std::string& user = "alice") {
        return test::RunProgram(
            "", {"sh", "-c",
                 "cd " + folder_.Path("") + "; module=" + user +
                     "@127.0.0.1::.zel_push/; exec rsync --port=" + std::to_string(port_) +
                     " --password-file=password " + options + " " + paths});
    };
    const std::string early = "--early-input=early ";
    const std::string as_ours =
        "-rlptgoD --whole-file --delete-after --modify-window=-1 "
        "--numeric-ids --backup --backup-dir=.zel_versions/" +
        id + " --temp-dir=.zel_partial/" + id + " ";
    const std::string push = "bait/ $module";
    ASSERT_EQ(ConnectionsOfAChange(), 1u);

    // No start, one of another client, of another state, and of another account: nothing is begun.
    EXPECT_NE(attack(as_ours, push).exit_code, 0);
    write_start("CLIENT-2");
    EXPECT_NE(attack(as_ours + early, push).exit_code, 0);
    write_start("CLIENT-1", id);
    EXPECT_NE(attack(as_ours + early, push).exit_code, 0);
    write_start("CLIENT-1");
    EXPECT_NE(attack(as_ours + early, push, "eve").exit_code, 0);
    EXPECT_EQ(ConnectionsOfAChange(), 1u);

    // With a start as it should be, but another run: that is refused, and was no push.
    const auto before = TreeOf(storage_ + "/docs");
    const std::vector<std::pair<std::string, std::string>> runs = {
        {"-r", "$module got/"},
        {"-r", "$module.zel_versions/ got/"},
        {"-r", push},
        {as_ours + "-n", push},
        {as_ours + "-M--fake-super", push},
        {as_ours + "-M--log-file=/x", push},
        {as_ours + "--inplace", push},
        {as_ours, "bait/ ${module}sub"}};
    for (const auto& [options, paths] : runs) {
        write_start("CLIENT-1");
        const test::Outcome ended = attack(early + options, paths);
        EXPECT_NE(ended.exit_code, 0) << options << paths;
        EXPECT_THAT(ended.output, Not(HasSubstr("early exec"))) << options << paths;
        EXPECT_FALSE(fs::exists(folder_.Path("got")) && !fs::is_empty(folder_.Path("got")));
        ASSERT_TRUE(test::Await(
            [&] { return fs::is_empty(folder_.Path("server/var/run/zel_server/.pushes")); }));
    }
    EXPECT_EQ(TreeOf(storage_ + "/docs"), before);
    EXPECT_FALSE(fs::exists(storage_ + "/bait"));
    EXPECT_EQ(ConnectionsOfAChange(), 1u);
    // And the very run is: the password's owner may push.
    write_start("CLIENT-1");
    EXPECT_EQ(attack(early + as_ours, push).exit_code, 0);
    EXPECT_TRUE(fs::exists(Copy("bait")));
}

}  // namespace

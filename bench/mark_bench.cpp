// Whether one mark on a file system would be better than a watch for each folder.
//
//     cmake --preset bench && cmake --build --preset bench --target mark_bench
//     TMPDIR=/volume build/bench/bin/mark_bench [FOLDERS]
//
// As root, on a machine that does nothing else: it drops the kernel's caches of folders. Below
// $TMPDIR, whose file system it marks, it makes a share of 100,000 folders, unless another number
// is given; then a share of 1,000, beside which others write. Each line ends in the ratio.
#include <fcntl.h>
#include <limits.h>
#include <poll.h>
#include <sys/fanotify.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <thread>
#include <unordered_set>
#include <vector>

#include "base/unique_fd.h"
#include "bench/large_tree.h"
#include "programs/zel_daemon/tree_list.h"
#include "programs/zel_daemon/watcher.h"
#include "tests/support/temp_root.h"

namespace {

using base::UniqueFd;
using zel_daemon::TreeList;
using zel_daemon::Watcher;
using zel_daemon::WatchLoss;

constexpr int kRuns = 3;
constexpr int kShareFolders = 1000;
constexpr int kOtherFolders = 200;
constexpr int kOtherFiles = 200000;
constexpr int kOtherWrites = 1000000;

[[noreturn]] void Fail(const std::string& what) {
    std::fprintf(stderr, "%s: %s\n", what.c_str(), std::strerror(errno));
    std::exit(1);
}

double Milliseconds(const std::function<void()>& work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
        .count();
}

double ThreadCpuMilliseconds() {
    timespec time;
    clock_gettime(CLOCK_THREAD_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) * 1e3 + static_cast<double>(time.tv_nsec) * 1e-6;
}

double Median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + static_cast<long>(values.size() / 2),
                     values.end());
    return values[values.size() / 2];
}

/// What the kernel holds for itself and cannot give back: above all the inodes of the folders that
/// have a watch. Objects are counted, since the pages that they shared may stay when they go.
double PinnedMebibytes() {
    sync();
    std::ofstream("/proc/sys/vm/drop_caches") << "2" << std::flush;
    usleep(200000);  // some is given back late
    std::ifstream slabs("/proc/slabinfo");
    double bytes = 0;
    for (std::string line; std::getline(slabs, line);) {
        char name[64];
        double objects = 0;
        double all = 0;
        double size = 0;
        if (std::sscanf(line.c_str(), "%63s %lf %lf %lf", name, &objects, &all, &size) == 4) {
            bytes += objects * size;
        }
    }
    return bytes / 1048576;
}

/// Where a folder is by now; empty when it is nowhere.
std::string PathOf(int volume, file_handle* folder) {
    const UniqueFd fd(open_by_handle_at(volume, folder, O_PATH | O_CLOEXEC));
    char path[PATH_MAX];
    const ssize_t size =
        fd ? readlink(("/proc/self/fd/" + std::to_string(fd.Get())).c_str(), path, sizeof(path))
           : 0;
    return {path, static_cast<size_t>(std::max<ssize_t>(size, 0))};
}

/// Tells every change on a file system; what is not below the share is thrown away.
class Mark {
public:
    explicit Mark(const std::string& share)
        : group_(fanotify_init(FAN_CLASS_NOTIF | FAN_REPORT_DFID_NAME | FAN_NONBLOCK | FAN_CLOEXEC,
                               O_RDONLY)),
          volume_(open(share.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC)),
          share_(share + "/") {
        constexpr uint64_t kMask = FAN_CREATE | FAN_DELETE | FAN_MODIFY | FAN_CLOSE_WRITE |
                                   FAN_ATTRIB | FAN_MOVED_FROM | FAN_MOVED_TO | FAN_ONDIR;
        if (!group_ || !volume_ ||
            fanotify_mark(group_.Get(), FAN_MARK_ADD | FAN_MARK_FILESYSTEM, kMask, AT_FDCWD,
                          share.c_str()) != 0) {
            Fail("no mark on the file system of '" + share + "'");
        }
    }

    int Fd() const { return group_.Get(); }
    size_t Overflows() const { return overflows_; }
    size_t Events() const { return events_; }

    void Read() {
        ssize_t left = read(group_.Get(), buffer_, sizeof(buffer_));
        for (auto* event = reinterpret_cast<fanotify_event_metadata*>(buffer_);
             FAN_EVENT_OK(event, left); event = FAN_EVENT_NEXT(event, left)) {
            ++events_;
            overflows_ += (event->mask & FAN_Q_OVERFLOW) != 0;
            auto* info = reinterpret_cast<fanotify_event_info_fid*>(event + 1);
            if (event->event_len > sizeof(*event) &&
                info->hdr.info_type != FAN_EVENT_INFO_TYPE_FID) {
                Take(reinterpret_cast<file_handle*>(info->handle));
            }
        }
    }

private:
    /// A folder is looked up once: nothing is cheaper than this.
    void Take(file_handle* folder) {
        std::string handle(reinterpret_cast<char*>(folder->f_handle), folder->handle_bytes);
        if (elsewhere_.count(handle) != 0) {
            return;
        }
        if (PathOf(volume_.Get(), folder).rfind(share_, 0) != 0) {
            elsewhere_.insert(std::move(handle));
        }
    }

    UniqueFd group_;
    UniqueFd volume_;
    const std::string share_;
    std::unordered_set<std::string> elsewhere_;
    size_t overflows_ = 0;
    size_t events_ = 0;
    alignas(fanotify_event_metadata) char buffer_[size_t{64} * 1024];
};

std::unique_ptr<Watcher> MakeWatcher() {
    auto watcher = std::make_unique<Watcher>(
        [](const std::string&, const std::string&) {},
        [](const std::string&, const std::string&, const std::string&) {},
        [](const std::string&, const WatchLoss&) { Fail("not all folders can be watched"); });
    if (!watcher->Open()) {
        Fail("inotify");
    }
    return watcher;
}

void WatchAll(Watcher& watcher, const std::string& share, int folders) {
    watcher.Add("share", share);
    while (watcher.Work(std::chrono::milliseconds(20))) {
    }
    if (watcher.Stats().folders != static_cast<size_t>(folders)) {
        Fail("not all folders could be made");
    }
}

void Start(int folders) {
    const test::TempFolder root;
    const std::string share = root.Path("share");
    bench::MakeTree(share, folders);
    const auto walk = [&] {
        TreeList list(share, "/", [] { return false; });
        TreeList::Entry entry;
        while (list.Next(entry) != TreeList::Found::kEnd) {
        }
    };
    walk();  // all start from a warm tree
    std::vector<double> watches, marks, walks;
    for (int i = 0; i < kRuns; ++i) {
        const auto watcher = MakeWatcher();
        watches.push_back(Milliseconds([&] { WatchAll(*watcher, share, folders); }));
        std::unique_ptr<Mark> mark;
        marks.push_back(Milliseconds([&] { mark = std::make_unique<Mark>(share); }));
        walks.push_back(Milliseconds(walk));
    }
    const std::string what = std::to_string(folders) + " folders: ";
    std::printf("%-44s %9.1f ms, one mark %9.3f ms: ratio %.0f\n", (what + "watched").c_str(),
                Median(watches), Median(marks), Median(watches) / Median(marks));
    std::printf("%-44s %9.1f ms, without watching %9.1f ms: ratio %.2f\n",
                (what + "watched and searched").c_str(), Median(watches) + Median(walks),
                Median(walks), 1 + Median(watches) / Median(walks));
    const double before = PinnedMebibytes();
    const Mark mark(share);
    const double marked = PinnedMebibytes() - before;
    const auto watcher = MakeWatcher();
    WatchAll(*watcher, share, folders);
    const double watched = PinnedMebibytes() - marked - before;
    std::printf("%-44s %9.1f MiB, one mark %9.1f MiB: %.0f bytes a folder\n",
                (what + "what the kernel keeps").c_str(), watched, marked,
                watched * 1048576 / folders);
}

/// What another program does on the volume; in a process of its own.
struct Others {
    const char* name;
    int count;
    std::function<void(const std::string& folder)> work;
};

struct Cost {
    double milliseconds;  // of the others
    double cpu = 0;       // of the thread that listens
};

Cost RunOthers(const Others& others, const std::string& folder,
               const std::function<int()>& listen_fd, const std::function<void()>& listen) {
    std::atomic<bool> done{false};
    Cost cost = {0};
    std::thread listener([&] {
        const double before = ThreadCpuMilliseconds();
        pollfd waiting = {listen_fd(), POLLIN, 0};
        while (poll(&waiting, 1, 20) > 0 || !done) {
            if (waiting.revents != 0) {
                listen();
            }
        }
        cost.cpu = ThreadCpuMilliseconds() - before;
    });
    cost.milliseconds = Milliseconds([&] {
        const pid_t child = fork();
        if (child == 0) {
            others.work(folder);
            _exit(0);
        }
        waitpid(child, nullptr, 0);
    });
    done = true;
    listener.join();
    return cost;
}

void WriteElsewhere(const Others& others) {
    const test::TempFolder root;
    const std::string share = root.Path("share");
    const std::string elsewhere = root.Path("elsewhere");
    bench::MakeTree(share, kShareFolders);
    bench::MakeTree(elsewhere, kOtherFolders);
    std::vector<double> alone, watched, marked, watch_cpu, mark_cpu;
    size_t overflows = 0;
    size_t events = 0;
    for (int i = -1; i < kRuns; ++i) {  // the first warms up
        const Cost free = RunOthers(
            others, elsewhere, [] { return -1; }, [] {});
        const auto watcher = MakeWatcher();
        WatchAll(*watcher, share, kShareFolders);
        const Cost watch = RunOthers(
            others, elsewhere, [&] { return watcher->Fd(); },
            [&] { watcher->Work(std::chrono::milliseconds(20)); });
        Mark mark(share);
        const Cost by_mark = RunOthers(
            others, elsewhere, [&] { return mark.Fd(); }, [&] { mark.Read(); });
        if (i >= 0) {
            alone.push_back(free.milliseconds);
            watched.push_back(watch.milliseconds);
            marked.push_back(by_mark.milliseconds);
            watch_cpu.push_back(watch.cpu);
            mark_cpu.push_back(by_mark.cpu);
            overflows += mark.Overflows();
            events = mark.Events();
        }
    }
    std::printf("%-44s %9.1f ms: %.0f a second\n", others.name, Median(alone),
                others.count / Median(alone) * 1e3);
    std::printf("%-44s %9.1f ms, with watches %9.1f ms: ratios %.2f, %.2f\n", "  with a mark",
                Median(marked), Median(watched), Median(marked) / Median(alone),
                Median(watched) / Median(alone));
    std::printf("%-44s %9.1f ms, of watches %9.1f ms; %zu events, %zu overflows\n",
                "  CPU time of a mark's reader", Median(mark_cpu), Median(watch_cpu), events,
                overflows);
}

void WriteFiles(const std::string& folder) {
    const std::string block(4096, 'x');
    std::vector<std::string> files;
    for (int i = 0; i < kOtherFiles; ++i) {
        const std::string path = folder + "/folder " + std::to_string(i % 10) + "/folder " +
                                 std::to_string(i / 10 % 10) + "/new " + std::to_string(i);
        const UniqueFd file(open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
        if (!file || write(file.Get(), block.data(), block.size()) < 0) {
            Fail(path);
        }
        files.push_back(path);
        if (files.size() == 1000) {
            for (const std::string& old : files) {
                unlink(old.c_str());
            }
            files.clear();
        }
    }
}

void WriteBlocks(const std::string& folder) {
    const std::string block(512, 'x');
    const UniqueFd file(open((folder + "/database").c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600));
    for (int i = 0; i < kOtherWrites; ++i) {
        if (pwrite(file.Get(), block.data(), block.size(), off_t{i % 1000} * 512) < 0) {
            Fail("database");
        }
    }
}

void Resolve() {
    const test::TempFolder root;
    const std::string share = root.Path("share");
    bench::MakeTree(share, kShareFolders);
    const UniqueFd volume(open(share.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    std::vector<std::vector<char>> handles;
    TreeList list(share, "/", [] { return false; });
    TreeList::Entry entry;
    while (list.Next(entry) != TreeList::Found::kEnd) {
        std::vector<char> handle(sizeof(file_handle) + MAX_HANDLE_SZ);
        auto* const head = reinterpret_cast<file_handle*>(handle.data());
        head->handle_bytes = MAX_HANDLE_SZ;
        int mount = 0;
        if (S_ISDIR(entry.facts.mode) &&
            name_to_handle_at(AT_FDCWD, (share + entry.path).c_str(), head, &mount, 0) == 0) {
            handles.push_back(std::move(handle));
        }
    }
    const double opened = Milliseconds([&] {
        for (auto& handle : handles) {
            if (PathOf(volume.Get(), reinterpret_cast<file_handle*>(handle.data())).empty()) {
                Fail("handle");
            }
        }
    });
    std::printf("%-44s %9.2f us\n", "the path of a folder, by its handle",
                opened * 1e3 / static_cast<double>(handles.size()));
}

}  // namespace

int main(int argc, char** argv) {
    Start(argc > 1 ? std::atoi(argv[1]) : 100000);
    WriteElsewhere({"200,000 files written and deleted elsewhere", kOtherFiles, WriteFiles});
    WriteElsewhere({"1,000,000 writes to a file elsewhere", kOtherWrites, WriteBlocks});
    Resolve();
    return 0;
}

// What it costs to watch a large tree, and to fold its changes.
//
//     cmake --preset bench && cmake --build --preset bench --target watcher_bench
//     build/bench/bin/watcher_bench [FOLDERS]
//
// Makes a tree of 100,000 folders, unless another number is given, below $TMPDIR. The search runs
// in turn with find on the warm tree, medians are compared. Changes are folded beside a plain
// std::set of the same paths, which grows without bound. Each line ends in the ratio.
#include <malloc.h>
#include <sys/resource.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <functional>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "bench/large_tree.h"
#include "programs/zel_daemon/change_set.h"
#include "programs/zel_daemon/watcher.h"
#include "tests/support/temp_root.h"

namespace {

using zel_daemon::ChangeSet;
using zel_daemon::Watcher;
using zel_daemon::WatchLoss;

constexpr int kRuns = 7;
constexpr auto kSlice = std::chrono::milliseconds(20);

double Milliseconds(const std::function<void()>& work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    const std::chrono::duration<double, std::milli> taken =
        std::chrono::steady_clock::now() - start;
    return taken.count();
}

/// Of this process alone.
double CpuMilliseconds() {
    timespec time;
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &time);
    return static_cast<double>(time.tv_sec) * 1e3 + static_cast<double>(time.tv_nsec) * 1e-6;
}

/// Of the programs that it ran.
double ChildrensCpuMilliseconds() {
    rusage usage;
    getrusage(RUSAGE_CHILDREN, &usage);
    return static_cast<double>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) * 1e3 +
           static_cast<double>(usage.ru_utime.tv_usec + usage.ru_stime.tv_usec) * 1e-3;
}

double Median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + kRuns / 2, values.end());
    return values[kRuns / 2];
}

/// Of the whole process: heap and stack, no files.
size_t ResidentBytes() {
    std::ifstream status("/proc/self/status");
    for (std::string word; status >> word;) {
        size_t kilobytes = 0;
        if (word == "RssAnon:" && status >> kilobytes) {
            return kilobytes * 1024;
        }
    }
    return 0;
}

struct Found {
    double milliseconds;
    double cpu;
    double longest_slice;  // in CPU time: what other programs took meanwhile is not its fault
};

Found WatchAll(Watcher& watcher, const std::string& folder, size_t folders) {
    Found found = {0, 0, 0};
    watcher.Add("share", folder);
    for (bool more = true; more;) {
        const double start = CpuMilliseconds();
        found.milliseconds += Milliseconds([&] { more = watcher.Work(kSlice); });
        const double slice = CpuMilliseconds() - start;
        found.cpu += slice;
        found.longest_slice = std::max(found.longest_slice, slice);
    }
    if (watcher.Stats().folders != folders || !watcher.Stats().complete) {
        std::fprintf(stderr, "only %zu folders are watched; see fs.inotify.max_user_watches\n",
                     watcher.Stats().folders);
        std::exit(1);
    }
    return found;
}

void Search(int folders) {
    const test::TempFolder root;
    bench::MakeTree(root.Path("tree"), folders);
    const std::string command = "find '" + root.Path("tree") + "' -type d >/dev/null";
    std::vector<double> ours, theirs, our_cpu, their_cpu;
    double longest = 0;
    size_t bytes = 0;
    for (int i = -1; i < kRuns; ++i) {  // the first warms the tree, and its memory counts
        malloc_trim(0);                 // else what was freed before is used again
        const size_t before = ResidentBytes();
        Watcher watcher([](const std::string&, const std::string&) {},
                        [](const std::string&, const std::string&, const std::string&) {},
                        [](const std::string&, const WatchLoss&) {});
        const Found found = WatchAll(watcher, root.Path("tree"), static_cast<size_t>(folders));
        bytes = i < 0 ? ResidentBytes() - before : bytes;
        const double cpu_before = ChildrensCpuMilliseconds();
        const double find = Milliseconds([&] {
            if (std::system(command.c_str()) != 0) {
                std::exit(1);
            }
        });
        if (i >= 0) {
            ours.push_back(found.milliseconds);
            theirs.push_back(find);
            our_cpu.push_back(found.cpu);
            their_cpu.push_back(ChildrensCpuMilliseconds() - cpu_before);
            longest = std::max(longest, found.longest_slice);
        }
    }
    std::printf(
        "%-44s %8.1f ms, find -type d %8.1f ms: ratio %.2f (wanted: at most 2; CPU time %.2f)\n",
        ("watch " + std::to_string(folders) + " folders").c_str(), Median(ours), Median(theirs),
        Median(ours) / Median(theirs), Median(our_cpu) / Median(their_cpu));
    std::printf("%-44s %8.1f ms, asked for %lld ms: ratio %.2f\n", "longest slice, CPU time",
                longest, static_cast<long long>(kSlice.count()),
                longest / static_cast<double>(kSlice.count()));
    const double each = static_cast<double>(bytes) / folders;
    std::printf("%-44s %8.1f bytes, wanted 200: ratio %.2f\n", "memory of each folder", each,
                each / 200);
}

void Fold(const char* what, const std::vector<std::string>& paths) {
    std::vector<double> ours, theirs;
    for (int i = 0; i < kRuns; ++i) {
        ours.push_back(Milliseconds([&] {
            ChangeSet set;
            for (const std::string& path : paths) {
                set.Add(path);
            }
            set.Take();
        }));
        theirs.push_back(Milliseconds([&] {
            std::set<std::string> set;
            for (const std::string& path : paths) {
                set.insert(path);
            }
        }));
    }
    std::printf("%-44s %8.1f ms, std::set %8.1f ms: ratio %.2f\n", what, Median(ours),
                Median(theirs), Median(ours) / Median(theirs));
}

void FoldAll() {
    const auto paths = [](int count, const std::function<std::string(int)>& path) {
        std::vector<std::string> all;
        for (int i = 0; i < count; ++i) {
            all.push_back(path(i));
        }
        return all;
    };
    const std::string folder = "/photos/2024/summer/";
    const auto number = [](int i) { return std::to_string(i); };
    Fold("50,000 paths in one folder", paths(50000, [&](int i) { return folder + number(i); }));
    Fold("100,000 paths in one folder", paths(100000, [&](int i) { return folder + number(i); }));
    Fold("50,000 paths in as many folders",
         paths(50000, [&](int i) { return folder + number(i) + "/f"; }));
    Fold("50,000 in 2,500 folders, the last first", paths(50000, [&](int i) {
             return "/" + number((50000 - i) / 20) + "/" + number(50000 - i);
         }));
    Fold("50,000 in 2,500 folders, in turn",
         paths(50000, [&](int i) { return "/" + number(i % 2500) + "/" + number(i); }));
    Fold("1,000,000 times the same path",
         paths(1000000, [&](int) { return folder + "IMG_1234.jpg"; }));
    std::string deep;
    for (int i = 0; i < 1000; ++i) {
        deep += "/d";
    }
    Fold("5,000 paths of 1,000 levels", paths(5000, [&](int i) { return deep + "/" + number(i); }));
    Fold("1,000 levels, each folder after what it holds", paths(1000, [&](int i) {
             return deep.substr(0, deep.size() - static_cast<size_t>(i) * 2);
         }));
}

}  // namespace

int main(int argc, char** argv) {
    Search(argc > 1 ? std::atoi(argv[1]) : 100000);
    FoldAll();
    return 0;
}

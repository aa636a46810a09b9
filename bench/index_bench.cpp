// What it costs to know what the copy of a share has, and to find what changed without the server.
//
//     cmake --preset bench && cmake --build --preset bench --target index_bench
//     build/bench/bin/index_bench [FILES]
//
// Makes a tree of 10,000 files, unless another number is given, fifty to a folder, below $TMPDIR.
// Runs alternate with their peers', medians are compared, each line ends in the ratio: the listing
// before a whole comparison and the search beside find, which prints the same facts; and the file
// beside a table of SQLite's with a row for each entry, of a change and of a large folder's move.
#include <fcntl.h>
#include <malloc.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "programs/zel_daemon/file_index.h"
#include "programs/zel_daemon/index_search.h"
#include "programs/zel_daemon/path_key.h"
#include "programs/zel_daemon/tree_list.h"
#include "tests/support/temp_root.h"

namespace {

using namespace zel_daemon;

constexpr int kRuns = 3;
constexpr int kChanges = 101;
constexpr int kFilesInAFolder = 50;
constexpr int kFoldersInAFolder = 100;

double Milliseconds(const std::function<void()>& work) {
    const auto start = std::chrono::steady_clock::now();
    work();
    return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start)
        .count();
}

double Median(std::vector<double> values) {
    std::nth_element(values.begin(), values.begin() + static_cast<long>(values.size() / 2),
                     values.end());
    return values[values.size() / 2];
}

void Print(const char* what, double ours, const char* peer, double theirs, const char* unit,
           const char* wanted) {
    std::printf("%-36s %9.2f %s, %-38s %9.2f %s: ratio %.2f (wanted: %s)\n", what, ours, unit, peer,
                theirs, unit, ours / theirs, wanted);
    std::fflush(stdout);
}

/// Ours and the peer's, in turns; the first of each is not counted.
void Compare(const char* what, const std::function<void()>& ours, const char* peer,
             const std::function<void()>& theirs, int runs, const char* wanted) {
    std::vector<double> our_times;
    std::vector<double> their_times;
    for (int i = -1; i < runs; ++i) {
        const double our_time = Milliseconds(ours);
        const double their_time = Milliseconds(theirs);
        if (i >= 0) {
            our_times.push_back(our_time);
            their_times.push_back(their_time);
        }
    }
    Print(what, Median(our_times), peer, Median(their_times), "ms", wanted);
}

std::string NameOf(int file) {
    const int folder = file / kFilesInAFolder;
    return "/year " + std::to_string(folder / kFoldersInAFolder) + "/album " +
           std::to_string(folder % kFoldersInAFolder) + "/IMG_" + std::to_string(100000 + file) +
           ".jpg";
}

void MakeTree(const std::string& top, int files) {
    mkdir(top.c_str(), 0755);
    for (int file = 0; file < files; ++file) {
        const std::string path = top + NameOf(file);
        if (file % kFilesInAFolder == 0) {
            const std::string folder = path.substr(0, path.rfind('/'));
            mkdir(folder.substr(0, folder.rfind('/')).c_str(), 0755);
            mkdir(folder.c_str(), 0755);
        }
        close(open(path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0644));
    }
}

void List(const std::string& top, const std::function<void(const TreeList::Entry&)>& take) {
    TreeList list(top, "/", [] { return false; });
    TreeList::Entry entry;
    while (list.Next(entry) == TreeList::Found::kEntry) {
        take(entry);
    }
}

uint64_t SizeOf(const std::string& path) {
    struct stat info = {};
    return stat(path.c_str(), &info) == 0 ? static_cast<uint64_t>(info.st_size) : 0;
}

void Find(const std::string& top) {
    const std::string command = "find '" + top + "' -printf '%p %m %i %s %T@ %C@\\n' >/dev/null";
    if (std::system(command.c_str()) != 0) {
        std::exit(1);
    }
}

/// A row for each entry, by its path.
void WriteTable(const std::string& path, const std::string& top) {
    unlink(path.c_str());
    std::ofstream(path).close();
    Database table(path);
    table.Execute(
        "PRAGMA synchronous = OFF; BEGIN; CREATE TABLE entries (path BLOB PRIMARY KEY, mode "
        "INTEGER, inode INTEGER, size INTEGER, modified INTEGER, changed INTEGER) WITHOUT ROWID");
    List(top, [&](const TreeList::Entry& entry) {
        const EntryFacts& facts = entry.facts;
        Query(table, "INSERT INTO entries VALUES (?, ?, ?, ?, ?, ?)", Bytes{KeyOf(entry.path)},
              facts.mode, facts.inode, facts.size, facts.modified, facts.changed)
            .Run();
    });
    table.Execute("COMMIT; PRAGMA synchronous = FULL; PRAGMA user_version = 1");
}

}  // namespace

int main(int argc, char** argv) {
    const int files = argc > 1 ? std::atoi(argv[1]) : 10000;
    const test::TempFolder root;
    const std::string top = root.Path("tree");
    const std::string file = root.Path("index/1/share");
    const std::string table = root.Path("table");
    MakeTree(top, files);
    usleep(100000);  // what is younger is always found

    IndexStamp stamp;
    stamp.settings = "settings";
    const auto write = [&] {
        FileIndex index(file);
        index.Clear();
        List(top,
             [&](const TreeList::Entry& entry) { index.Append(KeyOf(entry.path), entry.facts); });
        index.EndAppending();
        index.SetStamp(stamp);
    };
    const auto find = [&] { Find(top); };
    Compare(
        "listed into an index", write, "into a table with a row an entry",
        [&] { WriteTable(table, top); }, kRuns, "at most 1");
    Print("the index, of each file", static_cast<double>(SizeOf(file)) / files, "that table",
          static_cast<double>(SizeOf(table)) / files, "bytes", "at most 100 bytes");
    uint64_t changes = 0;
    size_t held = 0;
    malloc_trim(0);
    const size_t before = mallinfo2().uordblks;
    const auto search = [&] {
        FileIndex index(file);
        uint64_t count = 0;
        FindChanges(
            index, top,
            [&] {
                held = std::max(held, ++count % 8192 == 0 ? mallinfo2().uordblks - before : 0);
                return false;
            },
            [&](const std::string&) { ++changes; });
    };
    Compare("nothing has changed", search, "find with the same facts", find, kRuns, "at most 2");
    std::printf("%-36s %9zu KiB, %llu changes were found\n", "held meanwhile", held / 1024,
                static_cast<unsigned long long>(changes));
    int number = 0;
    const auto change = [&] {
        FileIndex index(file);
        IndexChanges noted;
        const std::string key = KeyOf(NameOf(number = (number + 7919) % files));
        noted.Replace(key);
        noted.Put(key, EntryFacts{S_IFREG | 0644, 1, 2, 3, 4, false, false});
        index.Change(noted, {}, stamp);
    };
    const auto row = [&] {
        Database rows(table);
        Query(rows, "UPDATE entries SET size = 2 WHERE path = ?",
              Bytes{KeyOf(NameOf(number = (number + 7919) % files))})
            .Run();
    };
    Compare("a change is noted", change, "in that table", row, kChanges, "at most 1.5");
    std::string from = KeyOf("/year 0");
    std::string to = KeyOf("/year -1");
    const auto move = [&] {
        FileIndex index(file);
        IndexChanges noted;
        noted.Move(from, to);
        index.Change(noted, {}, stamp);
    };
    const auto rows = [&] {
        Database moved(table);
        Query(moved,
              "UPDATE entries SET path = CAST(? || substr(path, ?) AS BLOB) WHERE path >= ? AND "
              "path < ?",
              Bytes{to}, from.size() + 1, Bytes{from}, Bytes{from + '\x01'})
            .Run();
        std::swap(from, to);
    };
    Compare("a folder of 5,000 files is moved", move, "in that table", rows, kRuns, "at most 0.5");
    return 0;
}

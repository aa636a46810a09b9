// What the pairing registry costs as it grows, beside GLib's key files and beside plain reading and
// writing.
//
//   cmake --preset bench && cmake --build --preset bench --target registry_bench &&
//   build/bench/bin/registry_bench
//
// The files lie in $TMPDIR (/tmp): give it a folder on the disk that is to be measured.
#include <fcntl.h>
#include <glib.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "ZEL/is_syncedshare.h"
#include "tarq/root_path.h"

namespace {

constexpr int kSizes[] = {100, 1000, 10000};
constexpr int kAdmittedShares = 100;

std::string path;  // of the registry

struct Op {
    const char* name;
    std::function<void()> prepare;  // not measured
    std::function<void()> run;
    bool waits =
        false;  // for the disk: the clock on the wall is measured, otherwise the processor's time
};

double Microseconds(clockid_t clock) {
    timespec time{};
    clock_gettime(clock, &time);
    return 1e6 * static_cast<double>(time.tv_sec) + 1e-3 * static_cast<double>(time.tv_nsec);
}

/// The median times of several operations in microseconds, measured in turns so that a busy machine
/// hits all alike.
std::vector<double> Medians(const std::vector<Op>& operations, int rounds) {
    std::vector<std::vector<double>> times(operations.size());
    for (int round = 0; round < rounds; ++round) {
        for (size_t i = 0; i < operations.size(); ++i) {
            operations[i].prepare();
            const clockid_t clock = operations[i].waits ? CLOCK_MONOTONIC : CLOCK_THREAD_CPUTIME_ID;
            const double start = Microseconds(clock);
            operations[i].run();
            times[i].push_back(Microseconds(clock) - start);
        }
    }
    std::vector<double> medians;
    for (std::vector<double>& all : times) {
        std::nth_element(all.begin(), all.begin() + rounds / 2, all.end());
        medians.push_back(all[static_cast<size_t>(rounds) / 2]);
    }
    return medians;
}

std::string ShareName(int i) {
    return "share of department " + std::to_string(i);
}

void MakeRegistry(int sections) {
    std::ofstream file(path, std::ios::trunc);
    file << "[PairedClientInfo]\n\tclientID=\"00:11:32:aa:bb:cc\"\n\tserverName="
            "\"nas\"\n\tzelEnabled=\"yes\"\n";
    for (int i = 1; i < sections; ++i) {
        switch (i % 4) {
            case 0:
                file << "[TASK_" << i << "]\n\tstatus=\"idle\"\n";
                break;
            case 1:
                file << "[CLIENTID_00:11:32:00:00:" << i << "]\n\tServerName=\"nas-" << i << "\"\n";
                break;
            default:
                file << "[SHARE_" << ShareName(i)
                     << "]\n\tCompleteID=\"00:11:32:aa:bb:cc\"\n\tRunningID=\"\"\n";
        }
    }
}

void Check(bool ok, const char* what) {
    if (!ok) {
        fprintf(stderr, "%s failed\n", what);
        exit(1);
    }
}

/// A file that changed just now is not kept in memory: the next look-up is a cold one.
void ForgetRegistry() {
    static mode_t mode = 0644;
    mode ^= 0040;
    Check(chmod(path.c_str(), mode) == 0, "chmod");
}

std::string PlainRead() {
    const int fd = open(path.c_str(), O_RDONLY);
    struct stat status {};
    fstat(fd, &status);
    const auto size = static_cast<size_t>(status.st_size);
    const std::unique_ptr<char[]> bytes(new char[size]);
    Check(read(fd, bytes.get(), size) == status.st_size, "read");
    close(fd);
    return {bytes.get(), 1};
}

void PlainWrite(const std::string& bytes) {
    const std::string temporary = path + ".plain";
    const int fd = open(temporary.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    Check(write(fd, bytes.data(), bytes.size()) == static_cast<ssize_t>(bytes.size()), "write");
    Check(fsync(fd) == 0 && close(fd) == 0, "fsync");
    Check(rename(temporary.c_str(), (path + ".copy").c_str()) == 0, "rename");
}

void GLibRead(const char* group, const char* key) {
    GKeyFile* file = g_key_file_new();
    Check(g_key_file_load_from_file(file, path.c_str(), G_KEY_FILE_NONE, nullptr), "GKeyFile");
    g_free(g_key_file_get_string(file, group, key, nullptr));
    g_key_file_free(file);
}

void GLibWrite(const char* group, const char* key) {
    GKeyFile* file = g_key_file_new();
    g_key_file_load_from_file(file, path.c_str(), G_KEY_FILE_KEEP_COMMENTS, nullptr);
    g_key_file_set_string(file, group, key, "\"00:11:32:aa:bb:cc\"");
    gsize size = 0;
    gchar* data = g_key_file_to_data(file, &size, nullptr);
    Check(
        g_file_set_contents_full((path + ".glib").c_str(), data, static_cast<gssize>(size),
                                 static_cast<GFileSetContentsFlags>(G_FILE_SET_CONTENTS_CONSISTENT |
                                                                    G_FILE_SET_CONTENTS_DURABLE),
                                 0644, nullptr),
        "GKeyFile");
    g_free(data);
    g_key_file_free(file);
}

void Status() {
    zel_svr_status status;
    Check(zel_svr_get_status(&status) == 0 && status.busy == 0, "zel_svr_get_status");
    zel_svr_put_status(&status);
}

struct Lists {
    KAPICSzList shares = KAPICSzListAlloc(kAdmittedShares);
    KAPICSzList refused = KAPICSzListAlloc(kAdmittedShares);
    explicit Lists(int sections) {
        for (int i = 0; i < kAdmittedShares; ++i) {
            const int number = i * sections / kAdmittedShares;
            KAPICSzListPush(shares, ShareName(number / 4 * 4 + 2).c_str());
        }
    }
    Lists(const Lists&) = delete;
    Lists& operator=(const Lists&) = delete;
    ~Lists() {
        KAPICSzListFree(shares);
        KAPICSzListFree(refused);
    }
};

}  // namespace

int main() {
    const std::string folder =
        std::filesystem::temp_directory_path() / ("registry_bench." + std::to_string(getpid()));
    std::filesystem::create_directories(folder + "/usr/tarq/etc");
    setenv("TARQ_ROOT", folder.c_str(), 1);
    path = TARQ::RootPath("/usr/tarq/etc/tarqZEL.info");

    std::vector<std::vector<double>> by_size;
    std::vector<double> bytes;
    std::vector<Op> operations;
    for (const int sections : kSizes) {
        MakeRegistry(sections);
        usleep(50'000);
        std::ifstream in(path, std::ios::binary);
        const std::string content{std::istreambuf_iterator<char>(in), {}};
        bytes.push_back(static_cast<double>(content.size()));
        Lists lists(sections);
        const std::string share = ShareName(sections / 2 / 4 * 4 + 2);  // in the middle of the file
        const std::string group = "SHARE_" + share;
        char value[64];
        const KAPICSzHash values = KAPICSzHashAlloc(2);
        KAPICSzHashSetValue(values, "RunningID", "");
        KAPICSzHashSetValue(values, "CompleteID", "00:11:32:aa:bb:cc");
        const auto nothing = [] {};
        const auto read_key = [&] {
            Check(KAPICFileGetSectionValue(path.c_str(), group.c_str(), "CompleteID", value,
                                           sizeof value) == 0,
                  "read");
        };
        operations = {
            {"status report (zel_svr_get_status)", nothing, Status},
            {"admission of 100 shares (ZELCheckIfSharePaired)", nothing,
             [&] {
                 Check(ZELCheckIfSharePaired(lists.shares, "A", &lists.refused) == 0, "admission");
             }},
            {"one key, file unchanged", nothing, read_key},
            {"one key, file changed", ForgetRegistry, read_key},
            {"reading the file's bytes", ForgetRegistry, PlainRead},
            {"one key with GKeyFile", ForgetRegistry,
             [&] { GLibRead(group.c_str(), "CompleteID"); }},
        };
        Medians({operations.begin(), operations.begin() + 3}, 10);
        std::vector<double> medians =
            Medians({operations.begin(), operations.begin() + 3}, sections > 1000 ? 30 : 200);
        // GKeyFile apart: its thousands of small blocks leave the allocator and the caches cold for
        // its neighbours.
        std::vector<double> cold = Medians({operations.begin() + 3, operations.end() - 1}, 500);
        cold.push_back(Medians({operations.back()}, 30).front());
        const std::vector<Op> writes = {
            {"one section written (ZELServerUpdateShare)", nothing,
             [&] { Check(ZELServerUpdateShare(share.c_str(), values) == 0, "write"); }, true},
            {"writing, flushing and renaming the file's bytes", nothing,
             [&] { PlainWrite(content); }, true},
            {"one key written with GKeyFile", nothing,
             [&] { GLibWrite(group.c_str(), "RunningID"); }, true},
        };
        std::vector<double> written = Medians({writes.begin(), writes.end() - 1}, 101);
        written.push_back(Medians({writes.back()}, 15).front());
        medians.insert(medians.end(), cold.begin(), cold.end());
        medians.insert(medians.end(), written.begin(), written.end());
        operations.insert(operations.end(), writes.begin(), writes.end());
        by_size.push_back(medians);
        KAPICSzHashFree(values);
    }

    printf("%-50s %12s %12s %12s  %s\n", "microseconds (median), at sections:", "100", "1,000",
           "10,000", "growth from 1,000 to 10,000");
    printf("%-50s %12.0f %12.0f %12.0f  x %.1f\n", "bytes of the file", bytes[0], bytes[1],
           bytes[2], bytes[2] / bytes[1]);
    for (size_t i = 0; i < operations.size(); ++i) {
        printf("%-50s %12.1f %12.1f %12.1f  x %.1f\n", operations[i].name, by_size[0][i],
               by_size[1][i], by_size[2][i], by_size[2][i] / by_size[1][i]);
    }
    const std::vector<double>& large = by_size[2];
    printf("\nAt 10,000 sections:\n");
    printf(
        "  one key of a changed file costs %.2f times reading the file's bytes (GKeyFile: %.1f "
        "times)\n",
        large[3] / large[4], large[5] / large[4]);
    printf(
        "  one section written costs %.2f times writing, flushing and renaming the file (GKeyFile: "
        "%.2f times)\n",
        large[6] / large[7], large[8] / large[7]);

    std::filesystem::remove_all(folder);
}

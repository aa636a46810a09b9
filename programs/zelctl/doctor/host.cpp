// The doctor's checks of this machine: programs, clock, watches, space.
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>

#include "base/config_file.h"
#include "base/text.h"
#include "base/whole_file.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/child_output.h"
#include "programs/zelctl/doctor/checks.h"
#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace zelctl {

namespace {

namespace fs = std::filesystem;

constexpr char kNeededRsync[] = "3.2.1";        // needed to pass commands to the server's handler
constexpr int64_t kFirstSaneTime = 1704067200;  // 2024: an earlier clock was reset
constexpr uint64_t kLittleSpace = uint64_t{256} << 20;
constexpr uint64_t kNoSpace = uint64_t{16} << 20;
constexpr uint64_t kFewInodes = 1000;
constexpr uint64_t kFewInstances = 16;

void AddFact(Findings& findings, const std::string& name, const std::string& finding) {
    findings.push_back({name, Severity::kOk, finding, ""});
}

/// A number from /proc/sys; 0 when it cannot be read.
uint64_t KernelNumber(const std::string& path) {
    const auto text = base::ReadFile(path, 64);
    return text ? base::ParseNumber(text->substr(0, text->find('\n')), UINT64_MAX).value_or(0) : 0;
}

// The number of folders in the tree of `folder`, itself included, but no more than `limit`.
uint64_t CountFolders(const std::string& folder, uint64_t limit) {
    uint64_t count = 1;
    std::error_code error;
    const auto options = fs::directory_options::skip_permission_denied;
    for (auto entry = fs::recursive_directory_iterator(folder, options, error);
         !error && entry != fs::recursive_directory_iterator() && count < limit;
         entry.increment(error)) {
        std::error_code ignored;
        count += entry->is_directory(ignored) && !entry->is_symlink(ignored) ? 1 : 0;
    }
    return count;
}

uint64_t CountAllFolders(const Patient& patient, uint64_t limit) {
    uint64_t count = 0;
    for (const auto& [name, tasks] : patient.shares) {
        TARQShare share = nullptr;
        const int found = TARQShareGet(name.c_str(), &share);
        const TARQ::ShareOwner owner(share);
        if (found == 0 && owner && owner->path != nullptr && count < limit) {
            count += CountFolders(owner->path, limit - count);
        }
    }
    return count;
}

}  // namespace

base::RsyncConfig RsyncSettings() {
    try {
        return base::ReadRsyncConfig(TARQ::RootPath(base::kRsyncConfigPath));
    } catch (const base::ConfigError&) {
        return {};
    }
}

bool IsUsableRsync(const std::string& text, std::string& version) {
    static constexpr char kHead[] = "version ";
    unsigned int major = 0;
    unsigned int minor = 0;
    unsigned int patch = 0;
    const size_t head = text.find(kHead);
    // Some builds put a "v" in front of the number.
    const size_t begin =
        head == std::string::npos
            ? head
            : std::min(text.find_first_not_of('v', head + sizeof kHead - 1), text.size());
    if (begin == std::string::npos ||
        sscanf(text.c_str() + begin, "%3u.%3u.%3u", &major, &minor, &patch) < 2) {
        version.clear();
        return false;
    }
    version = text.substr(begin, text.find_first_of(" \n", begin) - begin);
    return std::make_pair(major, std::make_pair(minor, patch)) >=
           std::make_pair(3U, std::make_pair(2U, 1U));
}

void CheckRsync(const Patient&, Findings& findings) {
    const std::string program = RsyncSettings().rsync;
    const ChildOutput answer = RunAndRead({program, "--version"});
    std::string version;
    if (!answer.failure.empty()) {
        findings.push_back({"rsync", Severity::kFailed, answer.failure,
                            std::string("install rsync ") + kNeededRsync +
                                " or later, or name it with 'rsync' in tarqrsync.conf"});
    } else if (!IsUsableRsync(answer.output, version)) {
        findings.push_back({"rsync", Severity::kFailed,
                            version.empty() ? program + " does not say what version it is"
                                            : program + " is version " + version,
                            std::string("install rsync ") + kNeededRsync + " or later"});
    } else {
        AddFact(findings, "rsync", "version " + version);
    }
}

void CheckSSH(const Patient& patient, Findings& findings) {
    const std::string program = RsyncSettings().ssh;
    const std::string path = FindInPath(program);
    if (!path.empty()) {
        AddFact(findings, "ssh", path);
    } else if (patient.UsesSSH()) {
        findings.push_back({"ssh", Severity::kFailed, program + " is not there, and tasks use it",
                            "install openssh-client, or name it with 'ssh' in tarqrsync.conf"});
    } else {
        AddFact(findings, "ssh", "not there; no task uses it");
    }
}

void CheckClock(const Patient&, Findings& findings) {
    const int64_t now = time(nullptr);
    const std::string shown = programs::HumanTime(now);
    const std::string state = TARQ::RootPath("/run/systemd/timesync");
    if (now < kFirstSaneTime) {
        findings.push_back({"clock", Severity::kFailed, "it shows " + shown,
                            "set the clock (timedatectl set-time), or let it be set: timedatectl "
                            "set-ntp true"});
    } else if (access(state.c_str(), F_OK) == 0 &&
               access((state + "/synchronized").c_str(), F_OK) != 0) {
        findings.push_back({"clock", Severity::kWarning, shown + ", not yet set over the network",
                            "timedatectl set-ntp true, and check that a time server is reachable"});
    } else {
        AddFact(findings, "clock", shown);
    }
}

void CheckWatches(const Patient& patient, Findings& findings) {
    const uint64_t limit = KernelNumber("/proc/sys/fs/inotify/max_user_watches");
    const uint64_t instances = KernelNumber("/proc/sys/fs/inotify/max_user_instances");
    if (limit == 0) {
        findings.push_back({"watches", Severity::kWarning, "the kernel tells no limit of watches",
                            "on-change tasks need a kernel with inotify"});
        return;
    }
    const uint64_t folders = patient.daemon_answers ? patient.daemon["folders"].asUInt64()
                                                    : CountAllFolders(patient, limit + 1);
    const std::string counted = programs::Count(folders, "folder") +
                                (patient.daemon_answers ? " watched" : " in all shares") +
                                ", at most " + std::to_string(limit);
    // Others use watches too, and new folders can appear quickly: warn at 90 %.
    if (folders >= limit - limit / 10) {
        findings.push_back(
            {"watches", folders >= limit ? Severity::kFailed : Severity::kWarning, counted,
             "sysctl fs.inotify.max_user_watches=" + std::to_string(folders * 2) +
                 " (and a line of that in /etc/sysctl.d/ to keep it): folders that are not "
                 "watched are compared every so often instead"});
    } else {
        AddFact(findings, "watches", counted);
    }
    if (instances < kFewInstances) {
        findings.push_back({"watch instances", Severity::kWarning,
                            "at most " + std::to_string(instances) + " of each user",
                            "sysctl fs.inotify.max_user_instances=128"});
    }
}

void CheckSpace(const Patient& patient, Findings& findings) {
    const std::string store = fs::path(StorePath(patient)).parent_path();
    for (const std::string& folder : {store, TARQ::RootPath("/tmp")}) {
        const std::string name = "space in " + folder;
        struct statvfs info = {};
        if (statvfs(folder.c_str(), &info) != 0) {
            // The daemon creates the store's folder when it is first started.
            const bool missing = errno == ENOENT;
            findings.push_back({name, missing ? Severity::kWarning : Severity::kFailed,
                                strerror(errno),
                                missing ? "start the daemon once: systemctl start zel_daemon"
                                        : "check the folder and its disk"});
            continue;
        }
        const uint64_t free = uint64_t{info.f_bavail} * info.f_frsize;
        // File systems without a fixed number of inodes report 0.
        const bool few_inodes = info.f_files != 0 && info.f_favail < kFewInodes;
        const std::string finding =
            programs::HumanBytes(free) + " free" +
            (few_inodes ? ", only " + programs::Count(info.f_favail, "inode") + " left" : "");
        if (free >= kLittleSpace && !few_inodes) {
            AddFact(findings, name, finding);
        } else {
            const bool none = free < kNoSpace || (few_inodes && info.f_favail == 0);
            findings.push_back({name, none ? Severity::kFailed : Severity::kWarning, finding,
                                "remove files that nobody needs from this file system"});
        }
    }
}

}  // namespace zelctl

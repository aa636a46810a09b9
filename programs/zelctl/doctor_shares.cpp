// The doctor's checks of shares, of the files that hold configuration and secrets, and of the
// daemon.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "programs/common/task_run.h"
#include "programs/common/text.h"
#include "programs/zelctl/doctor_checks.h"
#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"
#include "tarq/systemd.h"

namespace zelctl {

namespace {

namespace fs = std::filesystem;

constexpr char kUnit[] = "zel_daemon";
constexpr char kStore[] = "/usr/tarq/etc/zel_daemon/tasks.db";
constexpr char kCatalogue[] = "/usr/tarq/etc/tarqshare.conf";
constexpr int kProtocol = 1;

// What to do about a share that has a problem.
std::string RemedyOfShare(const std::string& name) {
    TARQShare record = nullptr;
    const bool found = TARQShareGet(name.c_str(), &record) == 0;
    const TARQ::ShareOwner share(record);
    if (found) {
        return "let the daemon's user read its folder; a share has to be on one of this machine's "
               "own disks";
    }
    switch (KAPICErrGet()) {
        case TARQ_ERR_NO_SHARE:
            return "zelctl share add '" + name + "' FOLDER, or take it out of the tasks";
        case TARQ_ERR_SHARE_VOLUME:
            return "mount its disk; if the share has moved: zelctl share confirm '" + name +
                   "', or share rm and share add";
        case TARQ_ERR_SHARE_IDENTITY:
            return "mount its disk; if the folder is the right one: zelctl share confirm '" + name +
                   "'";
        default:
            return "if the share has moved: zelctl share rm and zelctl share add";
    }
}

// What is wrong with the owner and the mode of a file that is there; empty when nothing is.
std::string FaultOfFile(const struct stat& info, mode_t forbidden) {
    if (info.st_uid != 0 && info.st_uid != geteuid()) {
        return "belongs to user " + std::to_string(info.st_uid);
    }
    if ((info.st_mode & forbidden) != 0) {
        char mode[8];
        snprintf(mode, sizeof mode, "%04o", static_cast<unsigned int>(info.st_mode & 07777));
        return std::string("has mode ") + mode;
    }
    return "";
}

// A file that others must not write, or, when it is secret, not even read.
void CheckFile(const std::string& path, bool secret, size_t& looked_at, Findings& findings) {
    struct stat info = {};
    if (stat(path.c_str(), &info) != 0) {
        if (errno != ENOENT) {
            findings.push_back(
                {"file " + path, Verdict::kWarning, strerror(errno), "run the doctor as root"});
        }
        return;
    }
    ++looked_at;
    const std::string fault = FaultOfFile(info, secret ? 0077 : 0022);
    if (!fault.empty()) {
        const std::string mode =
            S_ISDIR(info.st_mode) ? (secret ? "0700" : "0755") : (secret ? "0600" : "0644");
        findings.push_back({"file " + path, Verdict::kFailed,
                            fault + (secret ? "; it holds secrets" : "; others may change it"),
                            "chown root '" + path + "' && chmod " + mode + " '" + path + "'"});
    }
}

// The files with keys of an encrypted share.
std::vector<std::string> KeyFiles(const std::string& name) {
    TARQShare record = nullptr;
    const int found = TARQShareGet(name.c_str(), &record);
    const TARQ::ShareOwner share(record);
    std::vector<std::string> files;
    if (found == 0 && share && (share->flags & TARQ_SHARE_ENCRYPTED) != 0) {
        for (const auto get : {TARQShareEncAutoKeyFileGet, TARQShareEncKeyFileGet}) {
            char path[4096] = "";
            if (get(share.get(), path, sizeof path) == 0) {
                files.emplace_back(path);
            }
        }
    }
    return files;
}

bool IsUnitInstalled() {
    const std::string file = std::string(kUnit) + ".service";
    for (const char* folder : {"/etc/systemd/system/", "/usr/local/lib/systemd/system/",
                               "/usr/lib/systemd/system/", "/lib/systemd/system/"}) {
        if (access(TARQ::RootPath(folder + file).c_str(), F_OK) == 0) {
            return true;
        }
    }
    const TARQ::HashOwner section(KAPICSzHashAlloc(4));
    return section && KAPICFileGetSection(TARQ::RootPath("/usr/tarq/etc/tarqsystemd.conf").c_str(),
                                          kUnit, section.get()) > 0;
}

}  // namespace

std::string StorePath(const Patient& patient) {
    const std::string told = patient.daemon["store"].asString();
    return told.empty() ? TARQ::RootPath(kStore) : told;
}

void CheckCatalogue(const Patient& patient, Findings& findings) {
    const std::string path = TARQ::RootPath(kCatalogue);
    if (!patient.catalogue_error.empty()) {
        findings.push_back({"share catalogue", Verdict::kFailed,
                            path + ": " + patient.catalogue_error,
                            "make it readable; its form is in share-catalogue.md"});
    } else if (patient.shares.empty()) {
        findings.push_back({"share catalogue", Verdict::kWarning, "it has no shares",
                            "zelctl share add NAME FOLDER, or zelctl share import --samba"});
    }
    for (const auto& [name, tasks] : patient.shares) {
        const std::string fault = programs::ShareProblem(name);
        const std::string users = tasks.empty() ? "" : " (" + TasksInWords(tasks) + ")";
        if (fault.empty()) {
            findings.push_back({"share " + name, Verdict::kOk, "ready" + users, ""});
        } else {
            // One that no task sends hurts nobody yet.
            findings.push_back({"share " + name,
                                tasks.empty() ? Verdict::kWarning : Verdict::kFailed, fault + users,
                                RemedyOfShare(name)});
        }
    }
}

void CheckFiles(const Patient& patient, Findings& findings) {
    const size_t before = findings.size();
    size_t looked_at = 0;
    const std::string folder = TARQ::RootPath("/usr/tarq/etc");
    CheckFile(folder, false, looked_at, findings);
    for (const char* name :
         {"tarqshare.conf", "tarqrsync.conf", "tarqrsync_known_hosts", "tarqsdk.conf",
          "tarqcore.conf", "tarqsystemd.conf", "zel_daemon.conf"}) {
        CheckFile(folder + "/" + name, false, looked_at, findings);
    }
    const std::string store = StorePath(patient);
    CheckFile(fs::path(store).parent_path(), true, looked_at, findings);
    // SQLite keeps what is not yet in the file itself beside it.
    for (const char* suffix : {"", "-wal", "-shm"}) {
        CheckFile(store + suffix, true, looked_at, findings);
    }
    for (const auto& [name, tasks] : patient.shares) {
        for (const std::string& key : KeyFiles(name)) {
            CheckFile(key, true, looked_at, findings);
        }
    }
    if (findings.size() == before) {
        findings.push_back(
            {"files", Verdict::kOk,
             "owners and modes of " + std::to_string(looked_at) + " files are as they should be",
             ""});
    }
}

void CheckUnit(const Patient&, Findings& findings) {
    const std::string name = std::string("unit ") + kUnit;
    const int active = TARQSystemdActiveStatusGet(kUnit);
    if (active == 1) {
        findings.push_back({name, Verdict::kOk, "active", ""});
    } else if (!IsUnitInstalled()) {
        findings.push_back({name, Verdict::kFailed, "it is not installed",
                            "install the package, or its unit file, and 'systemctl "
                            "daemon-reload'"});
    } else {
        findings.push_back(
            {name, Verdict::kFailed,
             active == 0 ? "it is not active"
                         : "the service manager does not say whether it is "
                           "active",
             "systemctl enable --now zel_daemon; its log: journalctl -u zel_daemon"});
    }
}

void CheckDaemon(const Patient& patient, Findings& findings) {
    const int64_t protocol = patient.daemon["protocol"].asInt64();
    if (!patient.daemon_answers) {
        findings.push_back({"daemon", Verdict::kFailed, patient.daemon_error,
                            "systemctl restart zel_daemon; its log: journalctl -u zel_daemon"});
    } else if (protocol != kProtocol) {
        findings.push_back({"daemon", Verdict::kFailed,
                            "it speaks version " + std::to_string(protocol) + " of the protocol",
                            "install zelctl and zel_daemon of one version, and restart it"});
    } else {
        findings.push_back({"daemon", Verdict::kOk,
                            "version " + patient.daemon["version"].asString() + ", " +
                                programs::Count(patient.tasks.size(), "task"),
                            ""});
    }
}

}  // namespace zelctl

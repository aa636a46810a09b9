// The doctor's checks of shares, and of the files that hold configuration and secrets.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "programs/common/host.h"
#include "programs/common/text.h"
#include "programs/zelctl/doctor/checks.h"
#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"

namespace zelctl {

namespace {

namespace fs = std::filesystem;

constexpr char kCatalogue[] = "/usr/tarq/etc/tarqshare.conf";

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
                   "', or share rm --force and share add";
        case TARQ_ERR_SHARE_IDENTITY:
            return "mount its disk; if the folder is the right one: zelctl share confirm '" + name +
                   "'";
        default:
            return "if the share has moved: zelctl share rm --force and share add";
    }
}

// What is wrong with a file's owner and mode; empty when nothing is.
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

// Checks a file that others must not write or, if it is secret, must not read either.
void CheckFile(const std::string& path, bool secret, size_t& looked_at, Findings& findings) {
    struct stat info = {};
    if (stat(path.c_str(), &info) != 0) {
        if (errno != ENOENT) {
            findings.push_back(
                {"file " + path, Severity::kWarning, strerror(errno), "run the doctor as root"});
        }
        return;
    }
    ++looked_at;
    const std::string fault = FaultOfFile(info, secret ? 0077 : 0022);
    if (!fault.empty()) {
        const std::string mode =
            S_ISDIR(info.st_mode) ? (secret ? "0700" : "0755") : (secret ? "0600" : "0644");
        findings.push_back({"file " + path, Severity::kFailed,
                            fault + (secret ? "; it holds secrets" : "; others may change it"),
                            "chown root '" + path + "' && chmod " + mode + " '" + path + "'"});
    }
}

// The key files of an encrypted share.
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

}  // namespace

void CheckCatalogue(const Patient& patient, Findings& findings) {
    const std::string path = TARQ::RootPath(kCatalogue);
    if (!patient.catalogue_error.empty()) {
        findings.push_back({"share catalogue", Severity::kFailed,
                            path + ": " + patient.catalogue_error,
                            "make it readable; its form is in share-catalogue.md"});
    } else if (patient.shares.empty()) {
        findings.push_back({"share catalogue", Severity::kWarning, "it has no shares",
                            "zelctl share add NAME FOLDER, or zelctl share import --samba"});
    }
    for (const auto& [name, tasks] : patient.shares) {
        const std::string fault = programs::ShareProblem(name);
        const std::string users = tasks.empty() ? "" : " (" + TasksInWords(tasks) + ")";
        if (fault.empty()) {
            findings.push_back({"share " + name, Severity::kOk, "ready" + users, ""});
        } else {
            // A share that no task uses does no harm yet.
            findings.push_back({"share " + name,
                                tasks.empty() ? Severity::kWarning : Severity::kFailed,
                                fault + users, RemedyOfShare(name)});
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
    // SQLite keeps recent changes in files beside the database.
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
            {"files", Severity::kOk,
             "owner and mode of " + programs::Count(looked_at, "file") + " looked at, none to mend",
             ""});
    }
}

}  // namespace zelctl

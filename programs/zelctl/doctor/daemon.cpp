// The doctor's checks of the daemon: its configuration, its store, its unit, and whether it
// answers.
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <fstream>

#include "base/config_file.h"
#include "base/rsync_config.h"
#include "programs/common/text.h"
#include "programs/zel_daemon/daemon_config.h"
#include "programs/zelctl/base/child_output.h"
#include "programs/zelctl/doctor/checks.h"
#include "tarq/core.h"
#include "tarq/owners.h"
#include "tarq/root_path.h"
#include "tarq/systemd.h"

namespace zelctl {

namespace {

constexpr char kUnit[] = "zel_daemon";
constexpr char kStore[] = "/usr/tarq/etc/zel_daemon/tasks.db";
constexpr int kProtocol = 1;

// What is wrong with the database file, judged by its header and size; empty when nothing is, or
// when there is no file. With a write-ahead log beside it the size may differ, so only the header
// is checked.
std::string FaultOfStore(const std::string& path) {
    constexpr char kMagic[] = "SQLite format 3";
    constexpr size_t kHead = 100;
    struct stat info = {};
    if (stat(path.c_str(), &info) != 0) {
        return "";
    }
    std::ifstream file(path, std::ios::binary);
    unsigned char head[kHead] = {};
    file.read(reinterpret_cast<char*>(head), sizeof head);
    if (!file.is_open()) {
        return "";  // reported by the check of the files
    }
    if (info.st_size == 0) {
        return "is empty: its content is lost";
    }
    if (file.gcount() != static_cast<std::streamsize>(kHead) ||
        memcmp(head, kMagic, sizeof kMagic) != 0) {
        return "is damaged: it is no database";
    }
    const uint64_t page =
        (uint64_t{head[16]} << 8 | head[17]) == 1 ? 65536 : uint64_t{head[16]} << 8 | head[17];
    const uint64_t pages =
        uint64_t{head[28]} << 24 | uint64_t{head[29]} << 16 | uint64_t{head[30]} << 8 | head[31];
    struct stat beside = {};
    const bool all_in_it = stat((path + "-wal").c_str(), &beside) != 0 || beside.st_size == 0;
    return all_in_it && static_cast<uint64_t>(info.st_size) < page * pages
               ? "is damaged: " + programs::HumanBytes(static_cast<uint64_t>(info.st_size)) +
                     " are left of " + programs::HumanBytes(page * pages)
               : "";
}

// The last error that the daemon has logged since its last start; empty when unknown.
std::string LastWordsOfDaemon(const Patient& patient) {
    if (!TARQ::RootFolder().empty() || patient.daemon_fault == DaemonFault::kNotPermitted) {
        return "";
    }
    const ChildOutput log =
        RunAndRead({"journalctl", "--unit", kUnit, "--priority", "err", "--lines", "1", "--output",
                    "cat", "--boot", "--quiet", "--no-pager"});
    return log.failure.empty() && log.exit_code == 0 ? log.output.substr(0, log.output.find('\n'))
                                                     : "";
}

std::string RemedyOfDaemon(DaemonFault fault) {
    switch (fault) {
        case DaemonFault::kNotRunning:
            return "systemctl start zel_daemon; its log: journalctl -u zel_daemon";
        case DaemonFault::kNotPermitted:
            return "run it as root; to let members of a group ask: key 'group' of "
                   "zel_daemon.conf, then systemctl restart zel_daemon";
        case DaemonFault::kSilent:
            return "when it has too many connections, end the programs that hold them (ss -xp); "
                   "else systemctl restart zel_daemon; its log: journalctl -u zel_daemon";
        default:
            return "systemctl restart zel_daemon; its log: journalctl -u zel_daemon";
    }
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

void CheckUnit(const Patient&, Findings& findings) {
    const std::string name = std::string("unit ") + kUnit;
    const int active = TARQSystemdActiveStatusGet(kUnit);
    if (active == 1) {
        findings.push_back({name, Severity::kOk, "active", ""});
    } else if (!IsUnitInstalled()) {
        findings.push_back({name, Severity::kFailed, "it is not installed",
                            "install the package, or its unit file, and 'systemctl "
                            "daemon-reload'"});
    } else {
        findings.push_back(
            {name, Severity::kFailed,
             active == 0 ? "it is not active"
                         : "the service manager does not say whether it is "
                           "active",
             "systemctl enable --now zel_daemon; its log: journalctl -u zel_daemon"});
    }
}

void CheckDaemon(const Patient& patient, Findings& findings) {
    const int64_t protocol = patient.daemon["protocol"].asInt64();
    if (!patient.daemon_answers) {
        const std::string last_words = LastWordsOfDaemon(patient);
        findings.push_back({"daemon", Severity::kFailed,
                            patient.daemon_error +
                                (last_words.empty() ? "" : "; it last complained: " + last_words),
                            RemedyOfDaemon(patient.daemon_fault)});
    } else if (protocol != kProtocol) {
        findings.push_back({"daemon", Severity::kFailed,
                            "it speaks version " + std::to_string(protocol) + " of the protocol",
                            "install zelctl and zel_daemon of one version, and restart it"});
    } else if (!patient.daemon_error.empty()) {
        findings.push_back({"daemon", Severity::kFailed,
                            "it does not tell its tasks: " + patient.daemon_error,
                            "its log: journalctl -u zel_daemon"});
    } else {
        findings.push_back({"daemon", Severity::kOk,
                            "version " + patient.daemon["version"].asString() + ", " +
                                programs::Count(patient.tasks.size(), "task"),
                            ""});
    }
}

void CheckConfiguration(const Patient&, Findings& findings) {
    const size_t before = findings.size();
    const auto check = [&findings](const auto& read) {
        try {
            read();
        } catch (const base::ConfigError& error) {
            findings.push_back({"configuration", Severity::kFailed, error.what(),
                                "correct the line, then: zelctl reload"});
        }
    };
    check([] { base::ReadRsyncConfig(TARQ::RootPath(base::kRsyncConfigPath)); });
    check(zel_daemon::ReadDaemonConfig);
    if (findings.size() == before) {
        findings.push_back({"configuration", Severity::kOk, "nothing wrong in it", ""});
    }
}

void CheckStore(const Patient& patient, Findings& findings) {
    const std::string path = StorePath(patient);
    const std::string fault = FaultOfStore(path);
    if (!fault.empty()) {
        findings.push_back({"store", Severity::kFailed, path + " " + fault,
                            "stop the daemon, keep what is there (" + path +
                                "*), and put a backup in its place, see operations.md"});
    }
}

}  // namespace zelctl

// The checks of the doctor.
#pragma once

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"
#include "base/rsync_config.h"
#include "programs/zelctl/base/daemon_client.h"

namespace zelctl {

enum class Severity { kOk, kWarning, kFailed };

struct Finding {
    std::string name;  ///< of the checked item
    Severity severity;
    std::string finding;
    std::string remedy;  ///< empty when there is no problem
};

using Findings = std::vector<Finding>;

/// A task as reported by the daemon.
struct PatientTask {
    ZEL::SyncTask record;
    ZEL::PObject state;  ///< the daemon's map
};

/// Input of the checks, collected once.
struct Patient {
    bool daemon_answers = false;
    std::string daemon_error;  ///< why the daemon cannot be asked
    DaemonFault daemon_fault = DaemonFault::kNone;
    ZEL::PObject daemon;             ///< the reply to daemon_status
    std::vector<PatientTask> tasks;  ///< the daemon's; none when it does not answer
    bool has_passwords = false;      ///< whether the tasks include their passwords
    std::string no_passwords;        ///< why they do not
    std::set<std::string> cut_off;   ///< tasks whose server CheckServers() could not reach
    /// Shares of the catalogue and shares that tasks refer to, with the names of these tasks.
    std::map<std::string, std::set<std::string>> shares;
    std::string catalogue_error;  ///< why the catalogue cannot be read; empty when it can

    bool UsesSSH() const;
};

// Each check appends its findings.

void CheckRsync(const Patient& patient, Findings& findings);
void CheckSSH(const Patient& patient, Findings& findings);
void CheckClock(const Patient& patient, Findings& findings);
void CheckWatches(const Patient& patient, Findings& findings);
void CheckSpace(const Patient& patient, Findings& findings);
void CheckCatalogue(const Patient& patient, Findings& findings);
/// Returns the tasks whose server could not be reached.
std::set<std::string> CheckServers(const Patient& patient, Findings& findings);
/// Call it after CheckServers(): unreachable servers are not asked.
void CheckTasks(const Patient& patient, Findings& findings);
void CheckConfiguration(const Patient& patient, Findings& findings);
void CheckStore(const Patient& patient, Findings& findings);
void CheckFiles(const Patient& patient, Findings& findings);
void CheckUnit(const Patient& patient, Findings& findings);
void CheckDaemon(const Patient& patient, Findings& findings);

/// "task a", "tasks a, b", or how many they are
std::string TasksInWords(const std::set<std::string>& names);

/// The settings for rsync and ssh; the defaults when their configuration file is faulty.
base::RsyncConfig RsyncSettings();

/// Where the daemon keeps its tasks.
std::string StorePath(const Patient& patient);

/// Whether the output of `rsync --version` is that of a version with all required features.
/// `version`: set to the version it reports.
bool IsUsableRsync(const std::string& text, std::string& version);

}  // namespace zelctl

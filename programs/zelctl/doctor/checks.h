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
    std::string name;  ///< of what was looked at
    Severity severity;
    std::string finding;
    std::string remedy;  ///< empty when all is well
};

using Findings = std::vector<Finding>;

/// A task as the daemon tells it.
struct PatientTask {
    ZEL::SyncTask record;
    ZEL::PObject state;  ///< the daemon's map
};

/// What the checks look at, gathered once.
struct Patient {
    bool daemon_answers = false;
    std::string daemon_error;  ///< why it does not
    DaemonFault daemon_fault = DaemonFault::kNone;
    ZEL::PObject daemon;             ///< the reply to daemon_status
    std::vector<PatientTask> tasks;  ///< the daemon's; none when it does not answer
    bool has_passwords = false;      ///< the tasks have them
    std::string no_passwords;        ///< why they do not
    std::set<std::string> cut_off;   ///< tasks whose server CheckServers() has not reached
    /// Shares of the catalogue, and those that tasks name, with the tasks' names.
    std::map<std::string, std::set<std::string>> shares;
    std::string catalogue_error;  ///< why the catalogue cannot be read; empty when it can

    bool UsesSSH() const;
};

// Each adds what it finds.

void CheckRsync(const Patient& patient, Findings& findings);
void CheckSSH(const Patient& patient, Findings& findings);
void CheckClock(const Patient& patient, Findings& findings);
void CheckWatches(const Patient& patient, Findings& findings);
void CheckSpace(const Patient& patient, Findings& findings);
void CheckCatalogue(const Patient& patient, Findings& findings);
/// Gives the tasks whose server is not reached.
std::set<std::string> CheckServers(const Patient& patient, Findings& findings);
/// After CheckServers(): servers that are not reached are not asked.
void CheckTasks(const Patient& patient, Findings& findings);
void CheckConfiguration(const Patient& patient, Findings& findings);
void CheckStore(const Patient& patient, Findings& findings);
void CheckFiles(const Patient& patient, Findings& findings);
void CheckUnit(const Patient& patient, Findings& findings);
void CheckDaemon(const Patient& patient, Findings& findings);

/// "task a", "tasks a, b", or how many they are
std::string TasksInWords(const std::set<std::string>& names);

/// How rsync and ssh are run here; as by default when the file that says so is faulty.
base::RsyncConfig RsyncSettings();

/// Where the daemon keeps its tasks.
std::string StorePath(const Patient& patient);

/// Whether the text of `rsync --version` tells of one that can do what is asked of it; `version`:
/// as it calls itself.
bool IsUsableRsync(const std::string& text, std::string& version);

}  // namespace zelctl

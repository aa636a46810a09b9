// The checks of the doctor.
#pragma once

#include <map>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "ZEL/pobject.h"
#include "ZEL/sync_obj.h"

namespace zelctl {

enum class Verdict { kOk, kWarning, kFailed };

struct Finding {
    std::string name;  ///< of what was looked at
    Verdict verdict;
    std::string finding;
    std::string remedy;  ///< empty when all is well
};

using Findings = std::vector<Finding>;

/// What the checks look at, gathered once.
struct Patient {
    bool daemon_answers = false;
    std::string daemon_error;          ///< why it does not
    ZEL::PObject daemon;               ///< the reply to daemon_status
    std::vector<ZEL::SyncTask> tasks;  ///< the daemon's; none when it does not answer
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
void CheckServers(const Patient& patient, Findings& findings);
void CheckFiles(const Patient& patient, Findings& findings);
void CheckUnit(const Patient& patient, Findings& findings);
void CheckDaemon(const Patient& patient, Findings& findings);

/// "task a", "tasks a, b", or how many they are
std::string TasksInWords(const std::set<std::string>& names);

/// A value of section "rsync" of /usr/tarq/etc/tarqrsync.conf, or `otherwise`.
std::string RsyncSetting(const char* key, const std::string& otherwise);

/// Where the daemon keeps its tasks.
std::string StorePath(const Patient& patient);

/// Whether the text of `rsync --version` tells of one that can do what is asked of it; `version`:
/// as it calls itself.
bool IsUsableRsync(const std::string& text, std::string& version);

}  // namespace zelctl

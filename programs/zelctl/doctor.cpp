#include "programs/zelctl/doctor.h"

#include <algorithm>
#include <cstdio>

#include "programs/common/table.h"
#include "programs/common/text.h"
#include "programs/zelctl/daemon_client.h"
#include "programs/zelctl/doctor_checks.h"
#include "tarq/owners.h"

namespace zelctl {

namespace {

using programs::Printable;

constexpr size_t kNamesShown = 3;

// In the order of what depends on what.
constexpr void (*kChecks[])(const Patient&, Findings&) = {
    CheckRsync, CheckSSH,     CheckClock, CheckCatalogue, CheckFiles,
    CheckSpace, CheckWatches, CheckUnit,  CheckDaemon,    CheckServers};

const char* Word(Verdict verdict) {
    switch (verdict) {
        case Verdict::kOk:
            return "ok";
        case Verdict::kWarning:
            return "warning";
        default:
            return "failed";
    }
}

Patient Examine() {
    Patient patient;
    ZEL::PObject request;
    request["command"] = "daemon_status";
    patient.daemon_answers = AskDaemon(request, patient.daemon, &patient.daemon_error) == kOk;
    if (patient.daemon_answers) {
        request["command"] = "task_list";
        ZEL::PObject reply;
        if (AskDaemon(request, reply, &patient.daemon_error) == kOk) {
            for (const ZEL::PObject& task : reply["tasks"].asArray()) {
                ZEL::SyncTask record;
                ZEL::PObj2SyncTask(task, record);
                for (const std::string& share : record.GetInfo().GetShareList()) {
                    patient.shares[share].insert(record.GetInfo().GetName());
                }
                patient.tasks.push_back(std::move(record));
            }
        }
    }
    const TARQ::ListOwner names(KAPICSzListAlloc(64));
    if (!names || TARQShareEnum(names.get()) < 0) {
        patient.catalogue_error = KAPICErrText(KAPICErrGet());
    }
    for (int i = 0; i < KAPICSzListCount(names.get()); ++i) {
        patient.shares[KAPICSzListGet(names.get(), i)];
    }
    return patient;
}

void PrintForPeople(const Findings& findings) {
    for (const Finding& finding : findings) {
        printf("%-8s %s: %s\n", Word(finding.verdict), Printable(finding.name).c_str(),
               Printable(finding.finding).c_str());
        if (!finding.remedy.empty()) {
            printf("         -> %s\n", Printable(finding.remedy).c_str());
        }
    }
}

}  // namespace

bool Patient::UsesSSH() const {
    return std::any_of(tasks.begin(), tasks.end(), [](const ZEL::SyncTask& task) {
        return task.GetInfo().GetSyncInfo().UseSSH();
    });
}

std::string TasksInWords(const std::set<std::string>& names) {
    if (names.size() > kNamesShown) {
        return programs::Count(names.size(), "task");
    }
    std::string joined;
    for (const std::string& name : names) {
        joined += (joined.empty() ? "" : ", ") + name;
    }
    return (names.size() == 1 ? "task " : "tasks ") + joined;
}

ExitCode Doctor(bool as_json) {
    const Patient patient = Examine();
    Findings findings;
    for (const auto check : kChecks) {
        check(patient, findings);
    }
    if (as_json) {
        programs::Table table({"NAME", "VERDICT", "FINDING", "REMEDY"});
        for (const Finding& finding : findings) {
            table.Add({finding.name, Word(finding.verdict), finding.finding, finding.remedy});
        }
        table.Print(true);
    } else {
        PrintForPeople(findings);
    }
    const bool failed = std::any_of(findings.begin(), findings.end(), [](const Finding& finding) {
        return finding.verdict == Verdict::kFailed;
    });
    return failed ? kLocal : kOk;
}

}  // namespace zelctl

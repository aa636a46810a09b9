#include "programs/zelctl/doctor/doctor.h"

#include <algorithm>
#include <cstdio>

#include "programs/common/table.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/doctor/checks.h"
#include "tarq/owners.h"

namespace zelctl {

namespace {

using programs::Printable;

constexpr size_t kNamesShown = 3;

// In the order of what depends on what.
constexpr void (*kChecks[])(const Patient&, Findings&) = {
    CheckRsync, CheckSSH,     CheckClock, CheckConfiguration, CheckCatalogue, CheckFiles,
    CheckSpace, CheckWatches, CheckStore, CheckUnit,          CheckDaemon};

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

// The tasks, with their passwords when this user may see them.
ExitCode GetTasks(Patient& patient, ZEL::PObject& reply) {
    ZEL::PObject request;
    request["command"] = "task_list";
    request["secrets"] = 1;
    patient.has_passwords = AskDaemon(request, reply, &patient.no_passwords) == kOk;
    if (patient.has_passwords) {
        return kOk;
    }
    request["secrets"] = 0;
    return AskDaemon(request, reply, &patient.daemon_error);
}

void AskDaemonItself(Patient& patient) {
    DaemonConnection connection;
    ZEL::PObject request;
    request["command"] = "daemon_status";
    patient.daemon_answers = connection.Connect() == kOk && connection.Send(request) == kOk &&
                             connection.Receive(patient.daemon) == kOk;
    patient.daemon_error = connection.Error();
    patient.daemon_fault = connection.Fault();
}

Patient Examine() {
    Patient patient;
    AskDaemonItself(patient);
    ZEL::PObject reply;
    if (patient.daemon_answers && GetTasks(patient, reply) == kOk) {
        for (ZEL::PObject& state : reply["tasks"].asArray()) {
            PatientTask& task = patient.tasks.emplace_back();
            ZEL::PObj2SyncTask(state, task.record);
            task.state.swap(state);
            for (const std::string& share : task.record.GetInfo().GetShareList()) {
                patient.shares[share].insert(task.record.GetInfo().GetName());
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
    return std::any_of(tasks.begin(), tasks.end(), [](const PatientTask& task) {
        return task.record.GetInfo().GetSyncInfo().UseSSH();
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
    Patient patient = Examine();
    Findings findings;
    for (const auto check : kChecks) {
        check(patient, findings);
    }
    patient.cut_off = CheckServers(patient, findings);
    CheckTasks(patient, findings);
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

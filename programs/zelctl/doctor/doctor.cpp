#include "programs/zelctl/doctor/doctor.h"

#include <algorithm>
#include <cstdio>

#include "programs/common/failure.h"
#include "programs/common/table.h"
#include "programs/common/task_fields.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/doctor/checks.h"
#include "tarq/owners.h"
#include "tarq/rsync_servers.h"

namespace zelctl {

namespace {

using programs::Printable;

constexpr size_t kNamesShown = 3;

// In the order of their dependencies.
constexpr void (*kChecks[])(const Patient&, Findings&) = {
    CheckRsync, CheckSSH,     CheckClock, CheckConfiguration, CheckCatalogue, CheckFiles,
    CheckSpace, CheckWatches, CheckStore, CheckUnit,          CheckDaemon};

const char* Word(Severity severity) {
    switch (severity) {
        case Severity::kOk:
            return "ok";
        case Severity::kWarning:
            return "warning";
        default:
            return "failed";
    }
}

// The tasks, with their passwords when this user may read them.
ZEL::PObject GetTasks(Patient& patient) {
    ZEL::PObject request;
    request["command"] = "task_list";
    request["secrets"] = 1;
    try {
        ZEL::PObject reply = AskDaemon(request);
        patient.has_passwords = true;
        return reply;
    } catch (const programs::Failure& failure) {
        patient.no_passwords = failure.what();
    }
    request["secrets"] = 0;
    return AskDaemon(request);
}

void AskDaemonItself(Patient& patient) {
    DaemonConnection connection;
    ZEL::PObject request;
    request["command"] = "daemon_status";
    try {
        connection.Connect();
        connection.Send(request);
        patient.daemon = connection.Receive();
        patient.daemon_answers = true;
    } catch (const programs::Failure& failure) {
        patient.daemon_error = failure.what();
        patient.daemon_fault = connection.Fault();
    }
}

void AskForTasks(Patient& patient) {
    ZEL::PObject reply;
    try {
        reply = GetTasks(patient);
    } catch (const programs::Failure& failure) {
        patient.daemon_error = failure.what();
        return;
    }
    for (ZEL::PObject& state : reply["tasks"].asArray()) {
        PatientTask& task = patient.tasks.emplace_back();
        ZEL::PObj2SyncTask(state, task.record);
        task.state.swap(state);
        for (const std::string& share : task.record.GetInfo().GetShareList()) {
            patient.shares[share].insert(task.record.GetInfo().GetName());
        }
    }
}

Patient Examine() {
    Patient patient;
    AskDaemonItself(patient);
    if (patient.daemon_answers) {
        AskForTasks(patient);
    }
    const TARQ::ListOwner names(KAPICSzListAlloc(64));
    if (!names || TARQShareEnum(names.get()) < 0) {
        patient.catalogue_error = KAPICErrText(KAPICErrGet());
    }
    for (const std::string& name : TARQ::Entries(names)) {
        patient.shares[name];
    }
    return patient;
}

void PrintForPeople(const Findings& findings) {
    for (const Finding& finding : findings) {
        printf("%-8s %s: %s\n", Word(finding.severity), Printable(finding.name).c_str(),
               Printable(finding.finding).c_str());
        if (!finding.remedy.empty()) {
            printf("         -> %s\n", Printable(finding.remedy).c_str());
        }
    }
}

}  // namespace

bool Patient::UsesSSH() const {
    return std::any_of(tasks.begin(), tasks.end(), [](const PatientTask& task) {
        const ZEL::SyncInfo& info = task.record.GetInfo().GetSyncInfo();
        try {
            const auto known = TARQ::Backup::FindServer(programs::ServerOf(info));
            return known ? known->transport == TARQ::Backup::ServerTransport::SSH : info.UseSSH();
        } catch (const TARQ::Backup::ServersError&) {
            return info.UseSSH();  // reported by the check of the servers
        }
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

void Doctor(bool as_json) {
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
            table.Add({finding.name, Word(finding.severity), finding.finding, finding.remedy});
        }
        table.Print(true);
    } else {
        PrintForPeople(findings);
    }
    const bool failed = std::any_of(findings.begin(), findings.end(), [](const Finding& finding) {
        return finding.severity == Severity::kFailed;
    });
    if (failed) {
        throw programs::ReportedFailure(programs::FailureKind::kLocal);
    }
}

}  // namespace zelctl

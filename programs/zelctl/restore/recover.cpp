#include "programs/zelctl/restore/recover.h"

#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <ctime>
#include <map>
#include <set>
#include <utility>
#include <vector>

#include "ZEL/zel.h"
#include "base/make_folder.h"
#include "base/text.h"
#include "programs/common/configuration.h"
#include "programs/common/deposits.h"
#include "programs/common/failure.h"
#include "programs/common/recovery_notes.h"
#include "programs/common/run_result.h"
#include "programs/common/table.h"
#include "programs/common/task_fields.h"
#include "programs/common/task_settings.h"
#include "programs/common/terminal.h"
#include "programs/common/text.h"
#include "programs/zelctl/base/daemon_client.h"
#include "programs/zelctl/base/interrupt.h"
#include "programs/zelctl/base/moment.h"
#include "programs/zelctl/base/prepare.h"
#include "programs/zelctl/restore/restore.h"
#include "programs/zelctl/restore/share_place.h"
#include "programs/zelctl/share/commands.h"

namespace zelctl {

namespace {

using programs::Configuration;
using programs::Deposit;
using programs::Failure;
using programs::FailureKind;
using programs::ListedShare;
using programs::Printable;
using ZEL::PObject;

using Deposits = std::vector<Deposit>;
using Tasks = std::map<std::string, PObject>;  // by name

Tasks TasksHere() {
    PObject request;
    request["command"] = "task_list";
    request["export"] = 1;
    PObject reply = AskDaemon(request);
    Tasks tasks;
    for (PObject& task : reply["tasks"].asArray()) {
        const std::string name = std::as_const(task)["name"].asString();
        tasks[name].swap(task);
    }
    return tasks;
}

void PrintDeposits(const Deposits& deposits, bool as_json, bool numbered = false) {
    std::vector<programs::Column> columns = {"CLIENT", "NAME", "DEPOSITED", "BYTES"};
    if (numbered) {
        columns.insert(columns.begin(), "NUMBER");
    }
    programs::Table table(columns);
    size_t number = 0;
    for (const Deposit& deposit : deposits) {
        std::vector<std::string> row = {
            deposit.client, deposit.name,
            as_json ? std::to_string(deposit.time) : programs::HumanTime(deposit.time),
            std::to_string(deposit.bytes)};
        if (numbered) {
            row.insert(row.begin(), std::to_string(++number));
        }
        table.Add(std::move(row));
    }
    table.Print(as_json);
}

bool IsAskable() {
    return isatty(STDIN_FILENO) != 0;
}

// Those of the client that is meant, as of the moment that is.
Deposits Meant(Deposits deposits, const RecoverOptions& options) {
    const auto keep = [&](auto&& wanted) {
        deposits.erase(std::remove_if(deposits.begin(), deposits.end(),
                                      [&](const Deposit& deposit) { return !wanted(deposit); }),
                       deposits.end());
    };
    if (deposits.empty()) {
        throw Failure(FailureKind::kUsage,
                      "no client has left its configuration with this account of the server: "
                      "'zelctl restore --share NAME ...' brings files back, when you know the "
                      "share's name");
    }
    if (!options.from.empty()) {
        const bool is_identity =
            std::any_of(deposits.begin(), deposits.end(),
                        [&](const Deposit& deposit) { return deposit.client == options.from; });
        keep([&](const Deposit& deposit) {
            return (is_identity ? deposit.client : deposit.name) == options.from;
        });
        if (deposits.empty()) {
            throw Failure(FailureKind::kUsage, "client '" + Printable(options.from) +
                                                   "' has left nothing there: 'zelctl recover "
                                                   "--list' tells who has");
        }
    }
    if (!options.at.empty()) {
        const auto at = ParseMoment(options.at);
        if (!at || *at > time(nullptr)) {
            throw Failure(FailureKind::kUsage,
                          "--at: '" + Printable(options.at) +
                              "' is no moment 'YYYY-MM-DD HH:MM[:SS]' that has passed");
        }
        keep([&](const Deposit& deposit) { return deposit.time <= *at; });
        if (deposits.empty()) {
            throw Failure(FailureKind::kUsage, "nothing that was left there is as old as " +
                                                   Printable(options.at) +
                                                   ": 'zelctl recover --list' tells what there is");
        }
    }
    return deposits;
}

// What tells a deposit from others.
std::string MarkOf(const Deposit& deposit) {
    return deposit.client + " " + std::to_string(deposit.time);
}

// `begun`: that of a recovery which broke off. By now this machine may have left what it has of it.
Deposit Choose(const Deposits& deposits, const RecoverOptions& options, const std::string& begun) {
    for (const Deposit& deposit : deposits) {
        if (MarkOf(deposit) == begun) {
            return deposit;
        }
    }
    const bool one_client =
        std::all_of(deposits.begin(), deposits.end(),
                    [&](const Deposit& other) { return other.client == deposits.front().client; });
    const bool decided = options.yes || !options.from.empty() || !options.at.empty();
    if (deposits.size() == 1 || (one_client && (decided || !IsAskable()))) {
        return deposits.front();  // the youngest
    }
    PrintDeposits(deposits, false, true);
    if (options.yes || !IsAskable()) {
        throw Failure(FailureKind::kUsage,
                      "several clients have left their configuration there: say which with --from");
    }
    fflush(stdout);
    const std::string answer = programs::Ask("Which one? Its number:");
    const auto number = base::ParseNumber(answer, deposits.size());
    if (!number || *number == 0) {
        throw Failure(FailureKind::kCancelled, "nothing was changed");
    }
    return deposits[static_cast<size_t>(*number) - 1];
}

/// One recovery, step by step.
class Recovery {
public:
    Recovery(const RecoverOptions& options, const ZEL::SyncInfo& info, Deposit deposit,
             Configuration lost, Tasks there, programs::RecoveryNotes& notes)
        : options_(options),
          info_(info),
          deposit_(std::move(deposit)),
          lost_(std::move(lost)),
          there_(std::move(there)),
          notes_(notes) {
        for (const ListedShare& share : lost_.shares) {
            known_[share.name] = share;
        }
    }

    /// Shares whose folders are there need nothing but their names.
    void AddFoundShares() {
        for (const PObject& task : lost_.tasks) {
            for (const std::string& name : programs::TextsOf(task["share_list"])) {
                const SharePlace place = PlaceOf(Find(name));
                if (!place.in_catalogue && place.is_there && place.problem.empty()) {
                    Add(Find(name));
                }
            }
        }
    }

    /// Adds the tasks. None of them runs: its shares may not be back yet.
    void AddTasks() {
        for (PObject& task : lost_.tasks) {
            const std::string name = std::as_const(task)["name"].asString();
            const std::string shown = "Task '" + Printable(name) + "'";
            const bool is_ours = IsOfThisServer(task);
            const PObject as_left(task);
            if (is_ours) {
                LeadToServer(task);
            }
            const auto before = there_.find(name);
            if (before != there_.end()) {
                if (!IsSame(before->second, task) && !IsSame(before->second, as_left)) {
                    printf("%s is there already, and another one: it stays as it is.\n",
                           shown.c_str());
                    ++left_;
                } else if (is_ours) {
                    ours_.insert(name);
                }
                continue;
            }
            if (is_ours) {
                notes_.AddTask(name);
            }
            task["command"] = "task_add";
            task["paused"] = 1;
            try {
                AskDaemon(task);
            } catch (const Failure& failure) {
                if (failure.Status() == 0) {
                    throw;  // the daemon cannot be asked
                }
                notes_.RemoveTask(name);
                printf("%s cannot be added: %s.\n", shown.c_str(), failure.what());
                ++left_;
                continue;
            }
            if (is_ours) {
                ours_.insert(name);
                printf("%s is added, and paused until its shares are back%s.\n", shown.c_str(),
                       SameServer(task, as_left)
                           ? ""
                           : ("; it led to '" + Printable(programs::ServerOf(as_left)) +
                              "', and leads to '" + Printable(programs::ServerOf(task)) + "' now")
                                 .c_str());
            } else {
                printf(
                    "%s leads to account '%s' of '%s': it is added without its password, and "
                    "paused. Say 'zelctl task edit %s --password', then 'zelctl task resume "
                    "%s'.\n",
                    shown.c_str(), Printable(std::as_const(task)["user"].asString()).c_str(),
                    Printable(programs::ServerOf(task)).c_str(), Printable(name).c_str(),
                    Printable(name).c_str());
            }
        }
    }

    void BringSharesBack() {
        std::set<std::string> seen;
        for (const PObject& task : lost_.tasks) {
            for (const std::string& share : programs::TextsOf(task["share_list"])) {
                if (ours_.count(task["name"].asString()) != 0 && seen.insert(share).second) {
                    BringBack(share);
                }
            }
        }
    }

    void ResumeTasks() {
        for (const PObject& task : lost_.tasks) {
            const std::string name = task["name"].asString();
            if (ours_.count(name) == 0) {
                continue;
            }
            if (notes_.Tasks().count(name) == 0) {
                const auto before = there_.find(name);
                if (before != there_.end() &&
                    before->second["status"].asInt32() == ZEL::TASK_STATUS_PAUSED) {
                    printf("Task '%s' was paused before, and stays so: 'zelctl task resume %s'.\n",
                           Printable(name).c_str(), Printable(name).c_str());
                }
                continue;
            }
            const std::vector<std::string> shares = programs::TextsOf(task["share_list"]);
            const bool whole =
                std::all_of(shares.begin(), shares.end(),
                            [&](const std::string& share) { return notes_.IsBack(share); });
            if (!whole || !options_.at.empty()) {
                printf(
                    "Task '%s' stays paused%s. When its folders are as they should be, say "
                    "'zelctl task resume %s': then they are pushed.\n",
                    Printable(name).c_str(),
                    whole ? ", as its shares are those of another time"
                          : ": not all of its shares are back",
                    Printable(name).c_str());
                if (whole) {
                    notes_.RemoveTask(name);
                }
                continue;
            }
            AskDaemon(TaskRequest("task_resume", name));
            notes_.RemoveTask(name);
            printf("Task '%s' runs by its schedule again.\n", Printable(name).c_str());
        }
        TellIdentity();
    }

    size_t Left() const { return left_; }

private:
    // An empty folder for one that the deposit does not tell of.
    ListedShare Find(const std::string& name) const {
        const auto found = known_.find(name);
        ListedShare share = found == known_.end() ? ListedShare() : found->second;
        share.name = name;
        return share;
    }

    // The client may have known the server by another name than is given now.
    bool IsOfThisServer(const PObject& task) const {
        const std::string server = programs::ServerOf(task);
        return task["user"].asString() == info_.GetUser() &&
               (server == deposit_.server || server == programs::ServerOf(info_));
    }

    static bool SameServer(const PObject& task, const PObject& other) {
        return programs::ServerOf(task) == programs::ServerOf(other);
    }

    void LeadToServer(PObject& task) const {
        if (programs::ServerOf(task) != programs::ServerOf(info_)) {
            task["server_name"] = info_.GetServerName();
            task["server_ip"] = info_.GetServerIP();
        }
        task["pswd"] = info_.GetPassword();
    }

    static bool IsSame(const PObject& task, const PObject& other) {
        programs::TaskSettings settings[2];
        const PObject* const maps[2] = {&task, &other};
        for (int i = 0; i < 2; ++i) {
            PObject map(*maps[i]);
            map.asMap().erase("pswd");
            settings[i].SetMap(map);
        }
        return settings[0].SameAs(settings[1]);
    }

    // False, after saying why, when the share cannot be added.
    bool Add(const ListedShare& share) {
        try {
            AddShare(share.name, share.folder, share.acl, share.windows);
            return true;
        } catch (const Failure& failure) {
            LeaveOut(share.name, failure.what());
            return false;
        }
    }

    void LeaveOut(const std::string& share, const std::string& why) {
        printf("Share '%s' does not come back now: %s.\n", Printable(share).c_str(), why.c_str());
        left_out_.insert(share);
        ++left_;
    }

    void BringBack(const std::string& name) {
        if (notes_.IsBack(name)) {
            printf("Share '%s' is back already.\n", Printable(name).c_str());
            return;
        }
        if (left_out_.count(name) != 0) {
            return;  // why, was said
        }
        const ListedShare share = Find(name);
        const SharePlace place = PlaceOf(share);
        if (!place.problem.empty()) {
            LeaveOut(name, place.problem);
            return;
        }
        fflush(stdout);
        if (!options_.yes && !programs::Confirm("Bring share '" + Printable(name) + "' back into " +
                                                Printable(place.folder) +
                                                (place.is_filled ? ", whose files stay as they are?"
                                                 : place.is_there ? ", which is empty?"
                                                                  : ", which is made?"))) {
            return;
        }
        if (!place.in_catalogue) {
            if (!base::MakeFolder(place.folder, 0700)) {
                LeaveOut(name, programs::SystemFailure("its folder cannot be made").what());
                return;
            }
            if (!Add(share)) {
                return;
            }
        }
        const int status = RestoreApart({info_, name}, place.folder);
        if (status == 0) {
            notes_.ShareIsBack(name);
        } else if (status == programs::ExitStatusOf(FailureKind::kCancelled)) {
            throw programs::ReportedFailure(FailureKind::kCancelled);
        } else if (status < 0) {
            LeaveOut(name, "its restore was killed");
        } else {
            ++left_;  // it has said why
        }
    }

    // In a process of its own, which is kept to that folder: its exit status; -1 when it was
    // killed.
    int RestoreApart(const CopySource& source, const std::string& folder) const {
        RestoreOptions options;
        options.folder = folder;
        options.at = options_.at;
        fflush(nullptr);
        // A terminal's interrupt is for the restore, whose end tells of it.
        signal(SIGINT, SIG_IGN);
        const pid_t child = fork();
        if (child < 0) {
            throw programs::SystemFailure("cannot start a restore", FailureKind::kLocal);
        }
        if (child == 0) {
            prctl(PR_SET_PDEATHSIG, SIGTERM);
            const int status =
                programs::RunReporting("zelctl", [&] { RestoreFrom(source, options); });
            fflush(nullptr);
            _exit(status);
        }
        int status = 0;
        while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
        }
        signal(SIGINT, SIG_DFL);
        return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
    }

    void TellIdentity() const {
        if (deposit_.client != ZEL::GetClientID()) {
            const std::string lost = Printable(deposit_.client);
            printf(
                "The server knows the copies as those of client '%s', and this machine as "
                "'%s'. Until that is settled it refuses pushes: 'zel_server shares --release "
                "NAME' there gives a copy to this machine; or, when the other is gone for good, "
                "give this one its identity, serial=\"%s\" in section [device] of "
                "/usr/tarq/etc/tarqsdk.conf.\n",
                lost.c_str(), Printable(ZEL::GetClientID()).c_str(), lost.c_str());
        }
    }

    const RecoverOptions& options_;
    const ZEL::SyncInfo& info_;
    const Deposit deposit_;
    Configuration lost_;
    std::map<std::string, ListedShare> known_;  // the lost machine's, by name
    const Tasks there_;                         // this machine's
    std::set<std::string> ours_;                // tasks of this server and account
    programs::RecoveryNotes& notes_;
    std::set<std::string> left_out_;  // shares
    size_t left_ = 0;                 // what did not come back, and was not declined
};

Configuration Fetch(programs::DepositSession& session, const Deposit& deposit) {
    Configuration lost = programs::ReadConfiguration(session.Fetch(deposit));
    if (!lost.faults.empty()) {
        throw Failure("the configuration that '" + Printable(deposit.name) +
                      "' has left there cannot be used: " + lost.faults.front());
    }
    return lost;
}

}  // namespace

void ListDeposits(const RecoverOptions& options, bool as_json) {
    PrepareHost();
    const ZEL::SyncInfo info = options.connection.ToSyncInfo();
    WatchForInterrupt();
    programs::DepositSession session(info, Interrupted());
    session.Connect();
    PrintDeposits(session.List(), as_json);
}

void Recover(const RecoverOptions& options) {
    PrepareHost();
    if (!options.yes && !IsAskable()) {
        throw Failure(FailureKind::kUsage,
                      "nobody to ask which shares come back: say --yes to have all");
    }
    Tasks there = TasksHere();
    programs::RecoveryNotes notes;
    for (const std::string& task : std::set<std::string>(notes.Tasks())) {
        const auto found = there.find(task);
        // What a person has resumed meanwhile is no matter of the recovery any more.
        if (found == there.end() ||
            std::as_const(found->second)["status"].asInt32() != ZEL::TASK_STATUS_PAUSED) {
            notes.RemoveTask(task);
        }
    }
    const ZEL::SyncInfo info = options.connection.ToSyncInfo();
    WatchForInterrupt();
    programs::DepositSession session(info, Interrupted());
    session.Connect();
    const Deposits deposits = Meant(session.List(), options);
    StopWatchingForInterrupt();  // whoever is asked may go
    const Deposit deposit = Choose(deposits, options, notes.IsUnderWay() ? notes.Deposit() : "");
    notes.SetDeposit(MarkOf(deposit));
    printf("What '%s' (client '%s') left at %s:\n", Printable(deposit.name).c_str(),
           Printable(deposit.client).c_str(), programs::HumanTime(deposit.time).c_str());
    Recovery recovery(options, info, deposit, Fetch(session, deposit), std::move(there), notes);
    recovery.AddFoundShares();
    recovery.AddTasks();
    recovery.BringSharesBack();
    recovery.ResumeTasks();
    if (recovery.Left() != 0) {
        throw Failure(
            "not all came back, as told above: when that is mended, the same command "
            "goes on");
    }
}

}  // namespace zelctl

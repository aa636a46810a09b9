#include "programs/common/share_start.h"

#include "programs/common/copy_push.h"
#include "programs/common/server_status.h"
#include "programs/common/text.h"

namespace programs {

namespace {

// Length of the share names in one pairing command; a command has room for 5 KiB.
constexpr size_t kMaxPairedBytes = size_t{3} * 1024;

// A server of another kind wants a start command in its short form.
constexpr int kShortFormWanted = 202;

void PairTogether(ServerSession& session, bool dry_run, const std::list<std::string>& shares) {
    std::list<std::string> conflicts;
    int status = 0;
    const int asked = session.With().DoPairing(dry_run, shares, conflicts, status);
    // A server that pairs no shares by name may only acknowledge the command.
    if (asked == 0 && (status == kDone || status == kAccepted || status == kPassedThrough)) {
        return;
    }
    const Reach reach = ReachOfCommand(status);
    if (session.cancel || asked != 0 || status != kConflicts || conflicts.empty()) {
        throw session.Failed(
            "the server does not take " +
                (shares.size() == 1 ? QuotedShare(shares.front()) : std::string("these shares")),
            status, reach);
    }
    std::string taken;
    for (const std::string& share : conflicts) {
        taken += (taken.empty() ? "" : ", ") + QuotedShare(share);
    }
    throw RunFailure(FailureKind::kRefused, status,
                     taken + (conflicts.size() == 1 ? " belongs" : " belong") +
                         " to another client or account at the server",
                     reach);
}

// In the extended form, and once more in the short one when the server refuses it.
int SendStart(ServerSession& session, const std::string& share, const CopyPush& copy,
              std::string& told) {
    int status = 0;
    for (const bool extended : {true, false}) {
        std::list<std::string> lines;
        if (session.rsyncer.GenStartSyncShareCmd(share, extended, lines) != 0) {
            throw session.Failed(QuotedShare(share) + " cannot be announced", 0, Reach::kShare);
        }
        lines.insert(lines.end(), copy.Lines().begin(), copy.Lines().end());
        status = session.Send(std::move(lines), told);
        if (status != kShortFormWanted) {
            break;
        }
    }
    return status;
}

}  // namespace

Reach ReachOfCommand(int status) {
    switch (status) {
        case kDone:  // a problem of the share on this machine
        case kBadArgument:
        case kOtherAccount:
        case kConflicts:
        case kNoEncryption:
        case kStorage:
        case kNameTaken:
        case kTooManyShares:
        case kNotRunning:
        case kCopyWentOn:
        case kNobodysCopy:
            return Reach::kShare;
        default:
            return Reach::kRun;
    }
}

void PairShares(ServerSession& session, bool dry_run, const std::vector<std::string>& shares) {
    for (size_t begin = 0; begin < shares.size();) {
        size_t end = begin;
        for (size_t bytes = 0; end < shares.size(); ++end) {
            bytes += shares[end].size() + 1;
            if (end > begin && bytes > kMaxPairedBytes) {
                break;
            }
        }
        PairTogether(session, dry_run, {&shares[begin], &shares[begin] + (end - begin)});
        begin = end;
    }
}

void StartShare(ServerSession& session, const std::string& share, CopyPush& copy,
                const std::function<void(const std::string&)>& on_paired) {
    int status = 0;
    std::string told;
    for (const bool may_pair : {true, false}) {
        status = SendStart(session, share, copy, told);
        if (status != kNotPaired || !may_pair) {
            break;
        }
        PairShares(session, false, {share});
        if (on_paired) {
            on_paired(session.rsyncer.GetLatestIP());
        }
    }
    if (status == kDone) {
        Noted([&] { copy.Accepted(told); });
        return;
    }
    if (status >= kFirstServerStatus) {
        Noted([&] { copy.Refused(told, status == kCopyWentOn); });
    }
    throw session.Failed("the server does not take " + QuotedShare(share), status,
                         ReachOfCommand(status));
}

void SendShareKey(ServerSession& session, const std::string& share) {
    const int status = session.With().SyncEncryptKey(share);
    if (status != 0) {
        throw session.Failed("the key of encrypted " + QuotedShare(share) + " cannot be sent",
                             status, Reach::kShare);
    }
}

}  // namespace programs

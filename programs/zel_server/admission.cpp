#include "programs/zel_server/admission.h"

#include <algorithm>
#include <list>
#include <map>

#include "ZEL/is_syncedshare.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "programs/zel_server/share_record.h"
#include "tarq/owners.h"

namespace zel_server {

namespace {

using namespace programs;
using Names = std::vector<std::string>;

bool Contains(const Names& names, const std::string& name) {
    return std::find(names.begin(), names.end(), name) != names.end();
}

// Asks the registry into which of `shares` other clients push now; letter case is ignored.
int AskRegistry(const Names& shares, const std::string& client, Names& refused) {
    const TARQ::ListOwner asked(KAPICSzListAlloc(static_cast<int>(shares.size())));
    TARQ::ListOwner answer(KAPICSzListAlloc(static_cast<int>(shares.size())));
    if (!asked || !answer) {
        return kNoMemory;
    }
    for (const std::string& share : shares) {
        if (KAPICSzListPush(asked.get(), share.c_str()) != 0) {
            return kNoMemory;
        }
    }
    KAPICSzList list = answer.get();
    const int status = ZELCheckIfSharePaired(asked.get(), client.c_str(), &list);
    if (list != answer.get()) {
        static_cast<void>(answer.release());
        answer.reset(list);
    }
    for (int i = 0; i < KAPICSzListCount(list); ++i) {
        refused.emplace_back(KAPICSzListGet(list, i));
    }
    return status;
}

// The number of shares that belong to the account; nothing when the registry cannot be read. A
// share whose owner was lost does not count.
std::optional<size_t> SharesOf(const std::string& account) {
    const auto sections = SectionNames();
    if (!sections) {
        return std::nullopt;
    }
    const std::string prefix = "SHARE_";
    size_t count = 0;
    for (const std::string& name : *sections) {
        ShareState state;
        if (name.compare(0, prefix.size(), prefix) == 0) {
            ReadShare(name.substr(prefix.size()), state);
            count += state.account == account ? 1 : 0;
        }
    }
    return count;
}

class Admission {
public:
    Admission(const std::string& client, const std::string& account)
        : client_(client), account_(account) {}

    Refusal Of(const Names& shares) {
        const int asked = AskRegistry(shares, client_, running_);
        if (asked != kDone && asked != kConflicts) {
            return {asked, {}};
        }
        for (const std::string& share : shares) {
            const int status = StatusOf(share);
            if (status == kRegistryRead) {
                return {status, {}};
            }
            if (status != kDone) {
                Refuse(share, status);
            }
        }
        return LookAtNumber();
    }

private:
    int StatusOf(const std::string& share) {
        ShareState state;
        const ReadResult read = ReadShare(share, state);
        if (read == ReadResult::kFailed || read == ReadResult::kDamaged) {
            return kRegistryRead;
        }
        if ((!state.Owner().empty() && state.Owner() != client_) || Contains(running_, share)) {
            return kConflicts;
        }
        if (!state.account.empty() && state.account != account_) {
            return kOtherAccount;
        }
        // Two equivalent names within one request conflict in the same way.
        const std::string& first = seen_.emplace(ModuleKey(share), share).first->second;
        if (first != share || IsNameOfAnother(share)) {
            return kNameTaken;
        }
        if (state.account.empty() && !Contains(fresh_, share)) {
            fresh_.push_back(share);
        }
        return kDone;
    }

    void Refuse(const std::string& share, int status) {
        refusal_.status =
            refusal_.shares.empty() || refusal_.status == status ? status : kConflicts;
        refusal_.shares.push_back(share);
    }

    // Counting reads every share, so it is done only when there are new ones.
    Refusal LookAtNumber() {
        const auto has = fresh_.empty() ? std::optional<size_t>(0) : SharesOf(account_);
        if (!has) {
            return {kRegistryRead, {}};
        }
        const size_t room = kMaxAccountShares - std::min(*has, kMaxAccountShares);
        for (size_t i = room; i < fresh_.size(); ++i) {
            Refuse(fresh_[i], kTooManyShares);
        }
        return std::move(refusal_);
    }

    const std::string& client_;
    const std::string& account_;
    Names running_;
    Names fresh_;                              // shares that are new to the account
    std::map<std::string, std::string> seen_;  // by their module keys
    Refusal refusal_;
};

}  // namespace

Refusal RefusalOf(const Names& shares, const std::string& client, const std::string& account) {
    return Admission(client, account).Of(shares);
}

}  // namespace zel_server

#include "programs/zel_server/clients.h"

#include <algorithm>
#include <sstream>

#include "ZEL/is_syncedshare.h"
#include "programs/common/server_status.h"
#include "programs/zel_server/names.h"
#include "programs/zel_server/registry.h"
#include "tarq/owners.h"

namespace zel_server {

namespace {

using namespace programs;

constexpr char kPrefix[] = "CLIENTID_";
constexpr size_t kPrefixLength = sizeof kPrefix - 1;
constexpr char kPairing[] = "PairedClientInfo";
constexpr char kServerName[] = "ServerName";
constexpr char kAccounts[] = "Accounts";  // separated by blanks

// A record of an earlier version names no accounts: it applies to all of them until one pairs.
PairedClient FromSection(const std::string& id, Section& section) {
    PairedClient client{id, section[kServerName], {}};
    std::istringstream accounts(section[kAccounts]);
    for (std::string account; accounts >> account;) {
        client.accounts.push_back(account);
    }
    return client;
}

ReadResult ReadClient(const std::string& id, PairedClient& client) {
    Section section;
    const ReadResult read = ReadSection(kPrefix + id, section);
    client = FromSection(id, section);
    return read;
}

bool WriteClient(const PairedClient& client) {
    std::string accounts;
    for (const std::string& account : client.accounts) {
        accounts += (accounts.empty() ? "" : " ") + account;
    }
    return WriteSection(kPrefix + client.id,
                        {{kServerName, client.server_name}, {kAccounts, accounts}});
}

bool Has(const PairedClient& client, const std::string& account) {
    return std::find(client.accounts.begin(), client.accounts.end(), account) !=
           client.accounts.end();
}

// Keeps the pairing of the only paired client when the server begins to serve several.
int KeepSinglePairing(const std::string& new_client) {
    const int single = ZELServerIfOldClientPaired();
    if (single <= 0) {
        return single == 0 ? kDone : kRegistryRead;
    }
    Section pairing;
    if (ReadSection(kPairing, pairing) == ReadResult::kFailed) {
        return kRegistryRead;
    }
    return pairing["clientID"] == new_client || zel_svr_reset_pair() == 0 ? kDone : kRegistryWrite;
}

int ServeSeveral() {
    const TARQ::HashOwner pair =
        TARQ::MakeHash({{"clientID", kMultiSourceMarker}, {"serverName", kMultiSourceMarker}});
    return !pair ? kNoMemory : ZELServerSetPairValue(pair.get()) == 0 ? kDone : kRegistryWrite;
}

}  // namespace

std::optional<std::vector<PairedClient>> PairedClients() {
    const auto sections = SectionNames();
    if (!sections) {
        return std::nullopt;
    }
    std::vector<PairedClient> clients;
    for (const std::string& name : *sections) {
        PairedClient client;
        if (name.compare(0, kPrefixLength, kPrefix) == 0 &&
            ReadClient(name.substr(kPrefixLength), client) == ReadResult::kRead) {
            clients.push_back(client);
        }
    }
    Section pairing;
    ReadSection(kPairing, pairing);
    if (!pairing["clientID"].empty() && pairing["clientID"] != kMultiSourceMarker) {
        clients.push_back({pairing["clientID"], pairing["serverName"], {}});
    }
    return clients;
}

Paired IsPaired(const std::string& id, const std::string& account) {
    PairedClient client;
    const ReadResult own = ReadClient(id, client);
    if (own == ReadResult::kRead) {
        return client.accounts.empty() || Has(client, account) ? Paired::kYes : Paired::kNo;
    }
    Section pairing;
    if (own == ReadResult::kFailed || ReadSection(kPairing, pairing) == ReadResult::kFailed) {
        return Paired::kFailed;
    }
    return pairing["clientID"] == id ? Paired::kYes : Paired::kNo;
}

int PairingRefusal(const std::string& id, const std::string& account) {
    PairedClient client;
    const ReadResult own = ReadClient(id, client);
    // A client that already has a record does not count again.
    if (own != ReadResult::kMissing) {
        return own == ReadResult::kRead ? kDone : kRegistryRead;
    }
    const auto clients = PairedClients();
    if (!clients) {
        return kRegistryRead;
    }
    const auto begun =
        std::count_if(clients->begin(), clients->end(), [&](const PairedClient& other) {
            return !other.accounts.empty() && other.accounts.front() == account;
        });
    return static_cast<size_t>(begun) < kMaxAccountClients ? kDone : kTooManyClients;
}

int RecordPairing(const std::string& id, const std::string& account,
                  const std::string& server_name) {
    const int refusal = PairingRefusal(id, account);
    const int kept = refusal == kDone ? KeepSinglePairing(id) : refusal;
    if (kept != kDone) {
        return kept;
    }
    PairedClient client;
    if (ReadClient(id, client) == ReadResult::kFailed) {
        return kRegistryRead;
    }
    if (!Has(client, account)) {
        client.accounts.push_back(account);
    }
    if (client.accounts.front() == account) {
        client.server_name = server_name;
    }
    return WriteClient(client) ? ServeSeveral() : kRegistryWrite;
}

}  // namespace zel_server

// The paired clients: which ones the registry knows, and which accounts have paired them.
//
// A client's identity is its own claim, without proof. So its record lists the accounts that have
// paired it, and what one account says about it applies to that account alone: no account changes
// what another has said, and a client counts as paired only for accounts that did it themselves.
#pragma once

#include <optional>
#include <string>
#include <vector>

namespace zel_server {

/// Maximum number of clients whose record one account may create.
inline constexpr size_t kMaxAccountClients = 256;

struct PairedClient {
    std::string id;
    std::string server_name;            ///< the client's name for this server
    std::vector<std::string> accounts;  ///< that have paired it, in that order; empty: any
};

/// All of them; nothing when the registry cannot be read.
std::optional<std::vector<PairedClient>> PairedClients();

/// Whether the account has paired the client. kFailed: the registry cannot be read.
enum class Paired { kYes, kNo, kFailed };
Paired IsPaired(const std::string& client, const std::string& account);

/// The status with which RecordPairing would refuse; kDone when it would succeed.
int PairingRefusal(const std::string& client, const std::string& account);
/// Records that the account has paired the client, and that this server serves several clients.
/// Returns a status. Called with the registry's lock held.
int RecordPairing(const std::string& client, const std::string& account,
                  const std::string& server_name);

}  // namespace zel_server

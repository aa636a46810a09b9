// Finds what a damaged registry has lost, and restores it.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// All shares of the registry, in its order, followed by those that only have a record. Nothing
/// when either cannot be read.
std::optional<std::vector<std::string>> KnownShares();

struct RegistryDamage {
    bool switch_lost = false;            ///< nobody is admitted
    std::vector<std::string> shares;     ///< lost; their records name the owners
    std::vector<std::string> ownerless;  ///< lost, and the owner is not known

    bool None() const { return !switch_lost && shares.empty() && ownerless.empty(); }
};

/// Nothing when the registry or the folder of the records cannot be read.
std::optional<RegistryDamage> FindDamage();

/// Restores what is known: the owner, module and folder of each of `damage.shares`, and the switch
/// as the admin last set it. An unknown owner is never guessed: such a share stays closed until it
/// is released. A copy of the damaged file is kept at DamagedCopy(). Called with the registry's
/// lock held; false, with errno set, when something cannot be written.
bool MendRegistry(const RegistryDamage& damage, const ServerConfig& config);

/// Where the damaged file is kept.
std::string DamagedCopy();

}  // namespace zel_server

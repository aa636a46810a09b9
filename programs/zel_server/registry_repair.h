// A registry that has lost something: what that is, and putting it back.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "programs/zel_server/server_config.h"

namespace zel_server {

/// All shares that the registry names, in its order, and then those that only have a module.
/// Nothing when either cannot be read.
std::optional<std::vector<std::string>> KnownShares();

struct RegistryDamage {
    bool switch_lost = false;            ///< nobody is let in
    std::vector<std::string> shares;     ///< lost; their modules name whom they belong to
    std::vector<std::string> ownerless;  ///< lost, and nothing names whom they belong to

    bool None() const { return !switch_lost && shares.empty() && ownerless.empty(); }
};

/// Nothing when the registry or the folder of the modules cannot be read.
std::optional<RegistryDamage> FindDamage();

/// Puts back what can be known: of each of `damage.shares` its owner, module and folder, and the
/// switch as the admin last turned it. An owner that nothing names is never made up: such a share
/// stays closed until it is released. The damaged file is kept at DamagedCopy(). Under the
/// registry's lock; false, with errno set, when something cannot be written.
bool MendRegistry(const RegistryDamage& damage, const ServerConfig& config);

/// Where the damaged file is kept.
std::string DamagedCopy();

}  // namespace zel_server

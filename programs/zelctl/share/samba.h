// Import of the shares of a Samba server.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

struct SambaShare {
    std::string name;
    std::string path;     ///< as configured in Samba; empty when there is none
    std::string refusal;  ///< why it cannot be imported; empty when it can
};

/// The shares in the output of `testparm -s`, without Samba's special ones ([global], [homes],
/// printers). Accepts any text; unknown lines are ignored.
std::vector<SambaShare> ParseSambaShares(const std::string& text);

/// Imports the shares of the Samba configuration `config` (empty: the system's), or only those in
/// `names`, into the catalogue. `dry_run`: only lists them.
void ImportSambaShares(const std::string& config, const std::vector<std::string>& names,
                       bool dry_run);

}  // namespace zelctl

// Taking over the shares of a Samba server.
#pragma once

#include <string>
#include <vector>

namespace zelctl {

struct SambaShare {
    std::string name;
    std::string path;     ///< as Samba has it; empty when it names none
    std::string refusal;  ///< why it cannot be taken over; empty when it can
};

/// The shares in what `testparm -s` writes, without those that are Samba's own ([global], [homes],
/// printers). Any text is taken; lines that are of no known form are passed over.
std::vector<SambaShare> ParseSambaShares(const std::string& text);

/// Adds the shares of the Samba configuration `config` (empty: the system's) to the catalogue, or
/// only those of `names`. `dry_run`: only says which.
void ImportSambaShares(const std::string& config, const std::vector<std::string>& names,
                       bool dry_run);

}  // namespace zelctl

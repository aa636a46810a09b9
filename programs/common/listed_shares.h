// The shares of this machine as its catalogue has them.
#pragma once

#include <string>
#include <vector>

namespace programs {

struct ListedShare {
    std::string name;
    std::string folder;  ///< absolute
    std::string volume;  ///< where its volume was mounted when it was added; empty: not known
    bool acl = false;
    bool windows = false;
    bool encrypted = false;  ///< kept encrypted by the system, which alone makes such shares
};

/// All shares with a folder, by name, whether that is there now or not. Throws Failure (kLocal)
/// when the catalogue cannot be read.
std::vector<ListedShare> ListedShares();

}  // namespace programs

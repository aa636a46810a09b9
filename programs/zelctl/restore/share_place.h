// Where a share of a machine that was lost belongs on this one.
#pragma once

#include <string>

#include "programs/common/listed_shares.h"

namespace zelctl {

struct SharePlace {
    std::string folder;
    bool in_catalogue = false;  ///< the share is this machine's already
    bool is_there = false;      ///< the folder is
    bool is_filled = false;     ///< and has something in it
    std::string problem;        ///< why nothing can come back there now; empty: it can
};

/// The place of the share that the lost machine had so. A share of this name that this machine has
/// stays where it is.
SharePlace PlaceOf(const programs::ListedShare& share);

}  // namespace zelctl

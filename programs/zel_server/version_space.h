// Versions that are given up because a disk is nearly full.
//
// An account pays for what it has written itself: while less than the reserve is free, the bytes of
// each of its transfers are added to what it owes (space_debts.h). It pays with its own oldest
// versions, down to an age; where other accounts have copies, too, each has to fit into what it
// owes. So whoever fills a disk pushes out no version of another account, and none of his own that
// is younger. With nothing left to give, his disk is full.
#pragma once

#include "programs/zel_server/version_retention.h"

namespace zel_server {

/// Has each account that owes pay, as far as its disk is still short.
void PayForSpace(const KeepSettings& settings);

}  // namespace zel_server

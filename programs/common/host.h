// What a run expects of this machine.
#pragma once

#include <string>

namespace programs {

/// Why a share cannot be pushed: it is not in the catalogue, its folder cannot be read, or its
/// volume is not there or not fit for it. Empty when it can.
std::string ShareProblem(const std::string& share);

/// Makes the folders that the library expects of its host and no package may have made: for the
/// configuration, and for scratch files, which must be nobody else's to change: what somebody else
/// has put in their place is moved aside by who may. What is wrong; empty when all is well.
std::string PrepareHost();

}  // namespace programs

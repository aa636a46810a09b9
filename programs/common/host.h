// Requirements of a run on this machine.
#pragma once

#include <string>

namespace programs {

/// That a look-up of a share needs.
constexpr unsigned int kLookUpDescriptors = 4;

/// 0 when so many descriptors can be had now, else why not: an errno.
int LackOfDescriptors(unsigned int count);

/// Why a share cannot be pushed: it is not in the catalogue, its folder cannot be read, or its
/// volume is missing or not suitable. Empty when it can be pushed.
std::string ShareProblem(const std::string& share);

/// Creates the folders that the library expects but a package may not have created: for the
/// configuration, and for temporary files, which no other user may be able to change. What another
/// user has created in their place is moved aside, if this process may do so. Returns what is
/// wrong; empty when nothing is.
std::string PrepareHost();

}  // namespace programs

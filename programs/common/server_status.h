// The statuses that the server's command handler answers with; docs/server-commands.md says more.
#pragma once

#include <string>

namespace programs {

enum ServerStatus : int {
    kDone = 0,
    kUnknownCommand = 43,
    kNoMemory = 200,
    kBadArgument = 201,
    kRegistryWrite = 205,
    kRegistryRead = 206,
    kSwitchedOff = 210,
    kNotPaired = 211,
    kOtherAccount = 212,
    kConflicts = 214,
    kNoEncryption = 215,
    kStorage = 216,
    kNameTaken = 217,
    kNotRunning = 218,
    kServerFault = 219
};

/// What a status of a server command means and what to do about it, for a person; empty for one
/// that is not the command handler's.
std::string ServerStatusText(int status);

}  // namespace programs

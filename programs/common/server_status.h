// The statuses of server commands; docs/server-commands.md says more of the handler's.
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
    kServerFault = 219,

    // Of other servers.
    kUnsupportedCommand = 51,
    kAccepted = 207,       ///< the command was taken
    kPassedThrough = 208,  ///< and passed on

    // Of the library, which has asked nobody.
    kLookupFailed = 42,
    kNothingSent = 213,
    kKeyFileFailed = 300
};
constexpr int kFirstServerStatus = kNoMemory;  ///< what is less is rsync's, but for the few above

/// What a status of a server command means and what to do about it, for a person; empty for one
/// that says nothing by itself.
std::string ServerStatusText(int status);

}  // namespace programs

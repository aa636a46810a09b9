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
    kNoSuchShare = 220,
    kTooManyShares = 221,
    kTooManyTasks = 222,
    kTooManyConnections = 223,
    kTooManyClients = 224,
    kCopyWentOn = 225,       ///< others have pushed into the copy that the client knows
    kNobodysCopy = 226,      ///< there are files of this name, and nothing tells whose
    kNoBirthTimes = 230,     ///< the file system of the copies does not tell when a file was made
    kNothingThen = 231,      ///< nothing stood there at that time
    kNoSuchDeposit = 232,    ///< the client has not deposited that
    kTooManyDeposits = 233,  ///< of other clients of the account

    // From other servers.
    kUnsupportedCommand = 51,
    kAccepted = 207,       ///< the command was taken
    kPassedThrough = 208,  ///< and passed on

    // From the library itself; no server was asked.
    kLookupFailed = 42,
    kNothingSent = 213,
    kKeyFileFailed = 300,

    // The programs' own; the server was not asked.
    kNotConfirmed = 301  ///< a share waits until a person allows what its push would do
};
constexpr int kFirstServerStatus = kNoMemory;  ///< smaller ones are rsync's, except for a few above

/// The meaning of a status and what to do about it, for a person; empty for a status without a
/// specific meaning.
std::string ServerStatusText(int status);

}  // namespace programs

#include "programs/common/server_status.h"

namespace programs {

std::string ServerStatusText(int status) {
    switch (status) {
        case kLookupFailed:
            return "no such server: its name cannot be looked up";
        case kNothingSent:
            return "this machine has no identity to show to the server: no serial number and no "
                   "network interface; give it one in /usr/tarq/etc/tarqsdk.conf";
        case kUnknownCommand:
            return "the server does not know this command: run 'zel_server setup' there, or check "
                   "that the address "
                   "is the right one";
        case kNoMemory:
            return "the server is out of memory";
        case kBadArgument:
            return "the server finds an argument missing or unusable: a share's name has 1 to 80 "
                   "bytes, without "
                   "/ \\ : \" [ ] = %, does not begin with a dot, and an account or client name is "
                   "as plain";
        case kRegistryWrite:
            return "the server cannot write its registry: is its disk full?";
        case kRegistryRead:
            return "the server cannot read its registry, or has found it damaged: run 'zel_server "
                   "status' there";
        case kSwitchedOff:
            return "the server is switched off: run 'zel_server enable' there";
        case kNotPaired:
            return "this client is not paired with the server";
        case kOtherAccount:
            return "the share belongs to another account of the server: use that account, or run "
                   "'zel_server shares "
                   "--release NAME' there";
        case kConflicts:
            return "the share is another client's: choose another name, or run 'zel_server shares "
                   "--release NAME' "
                   "at the server";
        case kNoEncryption:
            return "the server is set up without encrypted shares";
        case kStorage:
            return "the server's storage folder is not there, not on the disk it was set up on, "
                   "not writable, or open to others: 'zel_server status' there says which";
        case kNameTaken:
            return "the server holds a share whose name differs only in letter case or blanks";
        case kNotRunning:
            return "the share is not being pushed by this client and account";
        case kServerFault:
            return "the server's program failed: its system log says why (journalctl -t zel_server "
                   "there)";
        case kTooManyShares:
            return "the account has as many shares as one may have: use another account for more, "
                   "or "
                   "run 'zel_server shares --release NAME' there";
        case kTooManyTasks:
            return "the account has as many tasks as one may have at the server";
        case kTooManyClients:
            return "the account has paired as many clients as one may pair: use another account";
        case kCopyWentOn:
            return "the copy was changed by another machine since this one last pushed it. Either "
                   "this machine was cloned: then give the clone a serial number of its own, in "
                   "/usr/tarq/etc/tarqsdk.conf. Or this machine was put back to an older state: "
                   "then look at its files first. When they are the ones to keep, say 'zelctl "
                   "share confirm NAME': the copy becomes like them";
        case kNobodysCopy:
            return "the server has files under this share's name and no record of whose they are: "
                   "'zel_server shares --release NAME' there lets the next client have them";
        case kNoSuchShare:
            return "the server holds no copy of the share";
        case kNoBirthTimes:
            return "the file system of the server's storage does not tell when a file was made: "
                   "what "
                   "stood at a time cannot be known";
        case kNothingThen:
            return "nothing stood there at that time: 'zelctl versions' lists when it changed";
        case kNoSuchDeposit:
            return "the server does not keep that configuration any more";
        case kTooManyDeposits:
            return "the server keeps the configurations of as many clients as one account may "
                   "have: run 'zel_server deposits' there, and remove those of clients that are "
                   "gone";
        case kTooManyConnections:
            return "the account has as many connections to the server as it may: wait until a push "
                   "has ended, or give this client an account of its own";
        default:
            return "";
    }
}

}  // namespace programs

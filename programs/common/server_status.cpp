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
            return "the server's storage folder is not there, not on the disk it was set up on, or "
                   "not writable";
        case kNameTaken:
            return "the server holds a share whose name differs only in letter case or blanks";
        case kNotRunning:
            return "the share is not being pushed by this client and account";
        case kServerFault:
            return "the server's program failed: its system log says why (journalctl -t zel_server "
                   "there)";
        default:
            return "";
    }
}

}  // namespace programs

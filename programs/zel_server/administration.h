// What the admin types: set-up, switch, accounts, and what there is to see.
#pragma once

namespace zel_server {

/// Parses the command line and does what it says. Returns the exit code: 0 done, 1 failed, 2 wrong
/// usage.
int Administer(int argc, char** argv);

}  // namespace zel_server

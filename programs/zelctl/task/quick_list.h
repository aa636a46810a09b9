#pragma once

namespace zelctl {

/// Asks the daemon for the list of tasks and prints it. False, with nothing printed, when that does
/// not work out for whatever reason: the command in full then tells why.
///
/// It stands on the wire format alone. What the other commands stand on takes longer to load than a
/// list of a thousand tasks takes to print.
bool PrintTaskListQuickly();

}  // namespace zelctl

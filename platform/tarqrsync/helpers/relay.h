#pragma once

#include <chrono>

#include "platform/tarqrsync/helpers/tls_connection.h"

namespace tarqrsync {

/// Carries bytes between the server and standard input and output until the server has closed the
/// connection; or, once the program that started this one is gone, until the server has what that
/// left behind, for a second at most. For that it leaves the process group, whose last process is
/// killed with the first. Throws ConnectError when the connection breaks, or when nothing has moved
/// in either direction for about `silence` (0: for ever): rsync waits for this program at its end,
/// and keeps no time there.
void Relay(TlsConnection& server, std::chrono::seconds silence);

}  // namespace tarqrsync

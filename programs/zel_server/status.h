// `zel_server status`.
#pragma once

namespace zel_server {

/// Prints the state of the server; fails when some or all pushes cannot succeed.
void ShowStatus(bool as_json);

}  // namespace zel_server

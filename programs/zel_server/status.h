// `zel_server status`.
#pragma once

namespace zel_server {

/// Writes how the server is; exit code 1 when pushes cannot succeed, all or some.
int ShowStatus(bool as_json);

}  // namespace zel_server

// `zel_server status`.
#pragma once

namespace zel_server {

/// Writes how the server is; fails when pushes cannot succeed, all or some.
void ShowStatus(bool as_json);

}  // namespace zel_server

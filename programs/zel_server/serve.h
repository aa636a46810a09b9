// The long-running processes of the server.
#pragma once

namespace zel_server {

/// `zel_server serve`: rewrites the rsync daemon's configuration from the server's own, and serves
/// connections until SIGTERM or SIGINT. `with_front`: runs the front as a child process, and fails
/// when that ends; otherwise the front has a unit of its own. Throws Failure.
void Serve(bool with_front);

/// `zel_server front`: replaces this process by the front. Throws Failure when it cannot.
void RunFront();

}  // namespace zel_server

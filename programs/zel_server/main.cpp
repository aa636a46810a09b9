#include <sys/stat.h>

#include <cstdio>
#include <string>

#include "programs/common/command_line.h"
#include "programs/zel_server/command_handler.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/transfer.h"

namespace {

// The client is shown what this prints.
bool HasRoom() {
    const zel_server::Admission admission = zel_server::AdmitConnection();
    if (admission == zel_server::Admission::kTooMany) {
        puts("The account has as many connections to the server as it may.");
    } else if (admission == zel_server::Admission::kNotServed) {
        puts("The server does not know of this connection: see 'zel_server status' there.");
    }
    return admission == zel_server::Admission::kAdmitted;
}

}  // namespace

int main(int argc, char** argv) {
    // Other users must not read the files of the server, the rsync daemon's log included.
    umask(027);
    // Without a full command-line parser: the rsync daemon calls these while a client waits.
    const std::string operation = argc == 2 ? argv[1] : "";
    if (operation == "handle-command") {
        return zel_server::HandleCommand();
    }
    if (operation == "begin-push") {
        return zel_server::BeginPush();
    }
    if (operation == "admit-transfer") {
        return zel_server::AdmitTransfer() == 0 && HasRoom() ? 0 : 1;
    }
    if (operation == "end-transfer") {
        return zel_server::EndTransfer();
    }
    return programs::RunFromLibrary("zel_server", "libzel_server_commands.so", 1, argc, argv);
}

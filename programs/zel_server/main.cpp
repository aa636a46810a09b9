#include <string>

#include "programs/common/command_line.h"
#include "programs/zel_server/command_handler.h"
#include "programs/zel_server/transfer.h"

int main(int argc, char** argv) {
    // The rsync daemon waits for these while a client waits for it.
    const std::string operation = argc == 2 ? argv[1] : "";
    if (operation == "handle-command") {
        return zel_server::HandleCommand();
    }
    if (operation == "admit-transfer") {
        return zel_server::AdmitTransfer();
    }
    if (operation == "end-transfer") {
        return zel_server::EndTransfer();
    }
    return programs::RunFromLibrary("zel_server", "libzel_server_commands.so", 1, argc, argv);
}

#include <string>

#include "programs/zel_server/administration.h"
#include "programs/zel_server/command_handler.h"
#include "programs/zel_server/transfer.h"

int main(int argc, char** argv) {
    // The rsync daemon waits for these while a client waits for it: they come before anything else
    // is set up.
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
    return zel_server::Administer(argc, argv);
}

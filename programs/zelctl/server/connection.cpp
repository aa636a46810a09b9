#include "programs/zelctl/server/connection.h"

#include <arpa/inet.h>

#include "programs/common/failure.h"
#include "programs/common/help.h"
#include "programs/common/terminal.h"

namespace zelctl {

namespace {

bool IsAddress(const std::string& text) {
    unsigned char address[16];
    return inet_pton(AF_INET, text.c_str(), address) == 1 ||
           inet_pton(AF_INET6, text.c_str(), address) == 1;
}

}  // namespace

void ConnectionOptions::AddTo(CLI::App* command) {
    command->add_option("-s,--server", server, "The server's name or address")->required();
    command->add_option("-u,--user", user, "Account on the server")->required();
    command->add_option(
        "--password-file", password_file,
        "File with the account's password ('-': standard input); else it is asked for");
    command->add_flag("--ssh", ssh, "Carry everything through ssh");
    command->add_option("--ssh-port", ssh_port, "Port of the ssh server")
        ->check(programs::Between(1, 65535))
        ->capture_default_str();
    command->add_option("--timeout", timeout, "Give up when nothing moves for so many seconds")
        ->option_text("SECONDS")
        ->check(programs::Between(600, 86400))
        ->capture_default_str();
    command->add_flag("--compress", compress, "Compress on the way");
    command->add_flag("--delta", delta, "Send only the changed blocks of files");
}

ZEL::SyncInfo ConnectionOptions::ToSyncInfo() const {
    ZEL::SyncInfo info;
    SetServer(server, info);
    info.SetUser(user);
    info.SetPassword(
        programs::ReadPassword(password_file, "Password of " + user + " on " + server + ": "));
    info.SetSSH(ssh);
    info.SetSSHPort(ssh_port);
    info.SetRsyncTimeout(timeout);
    info.SetCompression(compress);
    info.SetBlockLevelSync(delta);
    if (!info.Validate()) {
        throw programs::Failure(programs::FailureKind::kUsage,
                                "the server or the account is not given");
    }
    return info;
}

void SetServer(const std::string& server, ZEL::SyncInfo& info) {
    const bool is_address = IsAddress(server);
    info.SetServerIP(is_address ? server : "");
    info.SetServerName(is_address ? "" : server);
}

}  // namespace zelctl

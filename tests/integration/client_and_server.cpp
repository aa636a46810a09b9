#include "tests/integration/client_and_server.h"

#include <gtest/gtest.h>

#include <filesystem>

namespace fs = std::filesystem;

namespace test {

ClientAndServer::ClientAndServer() : port_(FreePort()) {
    for (const char* folder : {"client/usr/tarq/etc", "source"}) {
        fs::create_directories(folder_.Path(folder));
    }
    Must(Server({"setup", "--storage", storage_, "--port", std::to_string(port_), "--address",
                 "127.0.0.1"}));
    Must(Server({"account", "add", "alice", "--password-file", "-"}, "secret\n"));
    StartServer();
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
    folder_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"CLIENT-1\"\n");
    Write("a.txt", "alpha");
    Write("sub/b.txt", "beta");
    Write("-n\n odd \xc3\xa4", "odd");
    Must(Client({"share", "add", "docs", source_}));
}

void ClientAndServer::StartServer() {
    daemon_.Start({"rsync", "--daemon", "--no-detach",
                   "--config=" + folder_.Path("server/usr/tarq/etc/zel_server/rsyncd.conf")},
                  folder_.Path("daemon.log"), port_);
}

void ClientAndServer::Configure(const std::string& text) const {
    folder_.Write("client/usr/tarq/etc/tarqrsync.conf", text);
}

void ClientAndServer::Write(const std::string& name, const std::string& content) const {
    folder_.Write("source/" + name, content);
}

Outcome ClientAndServer::Server(std::vector<std::string> arguments,
                                const std::string& input) const {
    arguments.insert(arguments.begin(), ZEL_SERVER);
    return RunProgram(folder_.Path("server"), arguments, input);
}

Outcome ClientAndServer::Client(std::vector<std::string> arguments, const std::string& input,
                                const std::function<bool()>& cancelled) const {
    arguments.insert(arguments.begin(), ZELCTL);
    return RunProgram(folder_.Path("client"), arguments, input, cancelled);
}

std::string ClientAndServer::Differences(const std::string& share) const {
    const Outcome compared = RunProgram("", {"diff", "-r", source_, storage_ + "/" + share});
    return compared.exit_code == 0 ? "" : "differs: " + compared.output;
}

void ClientAndServer::ExpectCopyIsComplete() const {
    EXPECT_EQ(Differences(), "");
}

}  // namespace test

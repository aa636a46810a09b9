#include "tests/integration/client_and_server.h"

#include <gtest/gtest.h>
#include <sys/mount.h>

namespace test {

Outcome Zelctl(const std::string& root, const std::string& arguments, const std::string& input,
               const std::string& before) {
    return RunProgram(root, {"sh", "-c", before + "exec " ZELCTL " " + arguments}, input);
}

ClientAndServer::ClientAndServer() : port_(FreePort()), tls_port_(FreePort()) {
    SetUpServer();
    Must(Server("account add alice --password-file -", "secret words\n"));
    StartServer();
    Configure("[rsync]\nport=\"" + std::to_string(port_) + "\"\n");
    folder_.Write("client/usr/tarq/etc/tarqsdk.conf", "[device]\nserial=\"CLIENT-1\"\n");
    Write("a.txt", "alpha");
    Write("sub/b.txt", "beta");
    Write("-n\n odd \xc3\xa4", "odd");
    Must(Client("share add docs " + source_));
}

ClientAndServer::~ClientAndServer() {
    umount2(storage_.c_str(), MNT_DETACH);
}

void ClientAndServer::SetUpServer(const std::string& address) const {
    Must(Server("setup --address " + address + " --storage " + storage_ + " --plain-port " +
                std::to_string(port_) + " --port " + std::to_string(tls_port_)));
}

bool ClientAndServer::PutStorageOnDisk(const std::string& size) {
    const unsigned long again = on_disk_ ? MS_REMOUNT : 0;
    on_disk_ = mount("tmpfs", storage_.c_str(), "tmpfs", again, ("size=" + size).c_str()) == 0;
    if (on_disk_) {
        SetUpServer();  // which notes the disk
    }
    return on_disk_;
}

void ClientAndServer::StartServer() {
    daemon_.Start({"env", "TARQ_ROOT=" + folder_.Path("server"), ZEL_SERVER, "serve"},
                  folder_.Path("daemon.log"), port_);
}

void ClientAndServer::Configure(const std::string& text) const {
    folder_.Write("client/usr/tarq/etc/tarqrsync.conf", text);
}

void ClientAndServer::Write(const std::string& name, const std::string& content) const {
    folder_.Write("source/" + name, content);
}

Outcome ClientAndServer::Server(const std::string& arguments, const std::string& input) const {
    return RunProgram(folder_.Path("server"), {"sh", "-c", "exec " ZEL_SERVER " " + arguments},
                      input);
}

Outcome ClientAndServer::Client(const std::string& arguments, const std::string& input,
                                const std::string& before) const {
    return Zelctl(folder_.Path("client"), arguments, input, before);
}

void ClientAndServer::ExpectCopyIsComplete() const {
    EXPECT_EQ(RunProgram("", {"diff", "-r", "-x", ".zel_*", source_, storage_ + "/docs"}).output,
              "");
}

}  // namespace test

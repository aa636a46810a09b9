// A whole client and a whole server in folders of their own: the programs as people run them, on a
// real rsync daemon.
#pragma once

#include <gmock/gmock.h>

#include <string>

#include "tests/integration/servers.h"
#include "tests/support/temp_root.h"

namespace test {

/// Matches an Outcome with this exit code that has said `text`, among other things.
inline testing::Matcher<Outcome> Ended(int exit_code, const std::string& text = "") {
    return testing::AllOf(testing::Field(&Outcome::exit_code, exit_code),
                          testing::Field(&Outcome::output, testing::HasSubstr(text)));
}

/// Runs zelctl below a root folder with arguments as a shell takes them. `before`: what the shell
/// does before it becomes the program.
Outcome Zelctl(const std::string& root, const std::string& arguments, const std::string& input = "",
               const std::string& before = "");

/// A server with the account "alice" (password "secret words"), and a client "CLIENT-1" that knows
/// how to find it and has the share "docs" with three files.
class ClientAndServer {
public:
    ClientAndServer();
    ~ClientAndServer();

    void StartServer();
    void StopServer() { daemon_.Stop(); }

    /// Replaces the client's configuration of rsync.
    void Configure(const std::string& text) const;
    /// Writes a file of the share.
    void Write(const std::string& name, const std::string& content) const;

    /// Run zel_server and zelctl, see Zelctl().
    Outcome Server(const std::string& arguments, const std::string& input = "") const;
    Outcome Client(const std::string& arguments, const std::string& input = "",
                   const std::string& before = "") const;

    /// Gives the server's storage a disk of its own, or that one another size. False where the test
    /// may mount none.
    bool PutStorageOnDisk(const std::string& size);
    void ExpectCopyIsComplete() const;

private:
    bool on_disk_ = false;

protected:
    void SetUpServer(const std::string& address = "127.0.0.1") const;

    TempFolder folder_;
    const std::string source_ = folder_.Path("source");
    const std::string storage_ = folder_.Path("server/storage");
    int port_;
    int tls_port_;
    ServerProcess daemon_;
};

}  // namespace test

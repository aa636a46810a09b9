// A whole client and a whole server in folders of their own: the programs as people run them, on a
// real rsync daemon.
#pragma once

#include <gmock/gmock.h>

#include <functional>
#include <string>
#include <vector>

#include "tests/integration/servers.h"
#include "tests/support/temp_root.h"

namespace test {

/// Matches an Outcome with this exit code that has said `text`, among other things.
inline testing::Matcher<Outcome> Ended(int exit_code, const std::string& text = "") {
    return testing::AllOf(testing::Field(&Outcome::exit_code, exit_code),
                          testing::Field(&Outcome::output, testing::HasSubstr(text)));
}

/// A server with the account "alice" (password "secret"), and a client "CLIENT-1" that knows how to
/// find it and has the share "docs" with three files.
class ClientAndServer {
public:
    ClientAndServer();

    void StartServer();
    void StopServer() { daemon_.Stop(); }

    /// Replaces the client's configuration of rsync.
    void Configure(const std::string& text) const;
    /// Writes a file of the share.
    void Write(const std::string& name, const std::string& content) const;

    Outcome Server(std::vector<std::string> arguments, const std::string& input = "") const;
    Outcome Client(std::vector<std::string> arguments, const std::string& input = "",
                   const std::function<bool()>& cancelled = nullptr) const;

    /// What differs between the share and its copy; empty when nothing does.
    std::string Differences(const std::string& share = "docs") const;
    void ExpectCopyIsComplete() const;

protected:
    TempFolder folder_;
    const std::string source_ = folder_.Path("source");
    const std::string storage_ = folder_.Path("server/storage");
    int port_;
    ServerProcess daemon_;
};

}  // namespace test

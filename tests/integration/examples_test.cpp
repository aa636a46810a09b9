// The example programs, as a reader would run them.

#include "tests/integration/certificates.h"
#include "tests/support/testing.h"

namespace {

// A running listener, and the address that it says it listens on.
struct Listener {
    explicit Listener(const std::string& arguments)
        : command("echo $$; exec " EXAMPLE_LISTENER " " + arguments),
          pid(stoi(command.ReadLine())) {
        const std::string line = command.ReadLine();
        EXPECT_EQ(line.find("listening on "), 0U) << line;
        address = line.substr(line.rfind(' ') + 1);
    }
    ~Listener() { kill(pid, SIGTERM); }
    test::Command command;
    pid_t pid;
    std::string address;
};

std::string Send(const std::string& arguments) {
    int status = 0;
    const std::string output = test::Command(EXAMPLE_SENDER " " + arguments).Finish(status);
    return status == 0 ? output : "failed";
}

}  // namespace

TEST(Examples, TalkOverPathsAndPortsPlainAndWithTls) {
    const test::Certificates files;
    files.MakeSigned("nas", "-subj /CN=nas.example");
    const std::string reply = "{\"from\": \"sender\", \"text\": \"hello\"}\n";
    const std::string trust = " hello " + files.Path("ca.pem");
    for (const std::string& address : {files.Path("socket"), std::string("0")}) {
        const Listener plain(address);
        EXPECT_EQ(Send(plain.address + " hello"), reply);
        EXPECT_EQ(Send(plain.address + " hello"), reply) << "the listener goes on";
        const Listener tls(address + " " + files.Path("nas.pem") + " " + files.Path("nas.key"));
        EXPECT_EQ(Send(tls.address + trust + " nas.example"), reply);
        EXPECT_EQ(Send(tls.address + trust + " other.example"), "failed");
        EXPECT_EQ(Send(tls.address + trust + " nas.example"), reply);
    }
}

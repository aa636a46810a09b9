// The example programs, as a reader would run them.
#include <gtest/gtest.h>

#include "tests/integration/certificates.h"

namespace {

// What `sender` prints, or "failed".
std::string Send(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), EXAMPLE_SENDER);
    test::Child sender(arguments);
    std::string output;
    return sender.Finish(output) == 0 ? output : "failed";
}

// The address that `listener` says it listens on.
std::string Address(const test::Child& listener) {
    const std::string line = listener.ReadLine();
    EXPECT_EQ(line.find("listening on "), 0U) << line;
    return line.substr(line.rfind(' ') + 1);
}

}  // namespace

TEST(Examples, TalkOverPathsAndPortsPlainAndWithTls) {
    const test::Certificates files;
    files.MakeSigned("nas", {"-subj", "/CN=nas.example"});
    const std::string reply = "{\"from\": \"sender\", \"text\": \"hello\"}\n";
    for (const std::string& address : {files.Path("socket"), std::string("0")}) {
        test::Child plain({EXAMPLE_LISTENER, address});
        const std::string plain_address = Address(plain);
        EXPECT_EQ(Send({plain_address, "hello"}), reply);
        EXPECT_EQ(Send({plain_address, "hello"}), reply) << "the listener goes on";

        test::Child tls({EXAMPLE_LISTENER, address, files.Path("nas.pem"), files.Path("nas.key")});
        const std::string tls_address = Address(tls);
        EXPECT_EQ(Send({tls_address, "hello", files.Path("ca.pem"), "nas.example"}), reply);
        EXPECT_EQ(Send({tls_address, "hello", files.Path("ca.pem"), "other.example"}), "failed");
        EXPECT_EQ(Send({tls_address, "hello", files.Path("ca.pem"), "nas.example"}), reply);
    }
}

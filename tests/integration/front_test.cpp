// Who reaches the server, and how many at a time: its front and the connections that it hands on.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/stat.h>

#include <set>

#include "base/unix_socket.h"
#include "programs/zel_server/connections.h"
#include "programs/zel_server/control_messages.h"
#include "tests/integration/client_and_server.h"
#include "tests/support/testing.h"

using test::Ended;
using test::Must;
using namespace testing;

namespace {

using base::UniqueFd;

class FrontTest : public testing::Test, public test::ClientAndServer {
protected:
    test::Outcome Push() const {
        return Client("push docs -s 127.0.0.1 --password-file - -u alice", "secret words\n");
    }
    UniqueFd ConnectByTcp() const {
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_port = htons(static_cast<uint16_t>(port_));
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        UniqueFd fd(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
        return connect(fd.Get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0
                   ? std::move(fd)
                   : UniqueFd();
    }
    /// What the server says to a question about its connections.
    std::string Ask(const std::string& question) const {
        const auto address =
            base::UnixAddress::Of(folder_.Path("server/var/run/zel_server/.control"));
        const UniqueFd fd(socket(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0));
        char answer[zel_server::kMaxControlMessage];
        if (connect(fd.Get(), address->Get(), address->Size()) != 0 ||
            send(fd.Get(), question.data(), question.size(), MSG_NOSIGNAL) < 0) {
            return "not reached";
        }
        const ssize_t size = recv(fd.Get(), answer, sizeof answer, 0);
        return std::string(answer, static_cast<size_t>(std::max<ssize_t>(size, 0)));
    }
    /// The rsync daemons of the connections there are.
    std::set<std::string> Daemons() const {
        std::set<std::string> pids;
        const std::string config = "--config=" + folder_.Path("server");
        for (const auto& process : fs::directory_iterator("/proc")) {
            if (test::ReadFile(process.path() / "cmdline").find(config) != std::string::npos) {
                pids.insert(process.path().filename());
            }
        }
        return pids;
    }
    /// What a client of OpenSSL's says about the server.
    std::string TlsClient(const std::string& options) const {
        return test::RunProgram("", {"sh", "-c",
                                     "timeout 2 openssl s_client -connect 127.0.0.1:" +
                                         std::to_string(tls_port_) + " " + options + " 2>&1"})
            .output;
    }
    std::string Fingerprint() const {
        return test::RunProgram(
                   "", {"sh", "-c",
                        "openssl s_client -connect 127.0.0.1:" + std::to_string(tls_port_) +
                            " </dev/null 2>/dev/null | openssl x509 -pubkey -noout | "
                            "openssl pkey -pubin -outform der | openssl dgst -sha256 "
                            "-binary | base64 | tr -d '=\n'"})
            .output;
    }
};

TEST_F(FrontTest, WhoConnectsAndSaysNothingKeepsNobodyOut) {
    std::vector<UniqueFd> silent;
    for (int i = 0; i < 300; ++i) {
        silent.push_back(ConnectByTcp());
        ASSERT_TRUE(silent.back());
    }
    EXPECT_THAT(Push(), Ended(0));
    EXPECT_TRUE(test::Await([&] { return Daemons().size() <= zel_server::kMaxWaiting; }, 20));
    silent.clear();
    EXPECT_TRUE(test::Await([&] { return Daemons().empty(); }, 20));
}

TEST_F(FrontTest, AnAccountHasSixteenConnectionsAndLosesThemWhenItGoes) {
    std::vector<UniqueFd> connections;
    for (size_t i = 0; i < zel_server::kMaxAccountConnections + 2; ++i) {
        connections.push_back(ConnectByTcp());
    }
    ASSERT_TRUE(test::Await([&] { return Daemons().size() == connections.size(); }, 20));
    size_t admitted = 0;
    for (const std::string& pid : Daemons()) {
        admitted += Ask("login " + pid + " alice") == "yes" ? 1 : 0;
    }
    EXPECT_EQ(admitted, zel_server::kMaxAccountConnections);
    // Neither a push of that account nor one of another is confused by it.
    EXPECT_THAT(Push(), Ended(4, "as many connections to the server as it may"));
    Must(Server("account add bob --password-file -", "other words\n"));
    EXPECT_THAT(Client("push docs -s 127.0.0.1 --password-file - -u bob", "other words\n"),
                Ended(0));
    // What is no connection is not counted, and nonsense is answered.
    for (const char* question : {"login 1 alice", "login x alice", "login", "end", "end ..", "",
                                 " ", "login 99999999999999999999 alice"}) {
        EXPECT_THAT(Ask(question), AnyOf(Not("yes"), "0")) << question;
    }
    EXPECT_EQ(Ask("end alice"), "16");
    EXPECT_TRUE(test::Await([&] { return Daemons().size() <= 2; }, 20));
}

TEST_F(FrontTest, ModulesThatOthersCloseMeanwhileKeepNobodyOut) {
    const std::string open = folder_.Path("server/var/run/zel_server/.open/other");
    std::atomic<bool> over{false};
    std::thread others([&] {
        const auto name = [&](int i) { return open + std::to_string(i) + ".conf"; };
        for (int i = 0; !over; ++i) {
            std::ofstream(name(i)) << "[other" << i << "]\npath = /\n";
            fs::remove(name(i - 200));
        }
    });
    for (int i = 0; i < 100; ++i) {
        char byte = 0;  // of the greeting
        EXPECT_EQ(recv(ConnectByTcp().Get(), &byte, 1, 0), 1);
    }
    over = true;
    others.join();
}

TEST_F(FrontTest, OnlyTheFrontReachesTheDaemonsBehindIt) {
    if (geteuid() != 0) {
        GTEST_SKIP() << "needs another user";
    }
    const std::string socket = folder_.Path("server/var/run/zel_front/rsyncd");
    for (fs::path path = fs::path(socket).parent_path(); path != path.root_path() && path != "/tmp";
         path = path.parent_path()) {
        chmod(path.c_str(), 0755);  // who gets as far as that
    }
    const auto greeting = [&](const char* user) {
        return test::RunProgram(
                   "",
                   {"setpriv", user, "--clear-groups", "python3", "-c",
                    "import socket, sys; s = socket.socket(socket.AF_UNIX); s.settimeout(5); "
                    "s.connect(sys.argv[1]); s.send(b'PROXY TCP4 10.1.2.3 10.1.2.4 5 6\\r\\n'); "
                    "print(s.recv(100))",
                    socket})
            .output;
    };
    EXPECT_THAT(greeting("--reuid=65534"), Not(HasSubstr("@RSYNCD")));
    EXPECT_THAT(greeting("--reuid=0"), HasSubstr("@RSYNCD"));
    // A plain listener of rsync's own there is none.
    EXPECT_THAT(test::ReadFile(folder_.Path("server/usr/tarq/etc/zel_server/rsyncd.conf")),
                Not(HasSubstr("\nport")));
}

TEST_F(FrontTest, TlsIsOfTheThirdVersionAndTheKeyIsTheOneThatIsTold) {
    EXPECT_THAT(TlsClient("-tls1_2 </dev/null"), HasSubstr("alert"));
    EXPECT_THAT(TlsClient("-tls1_3 -quiet -verify_quiet </dev/null"), HasSubstr("@RSYNCD: "));
    const std::string key = Fingerprint();
    EXPECT_EQ(key.size(), 43U) << key;
    EXPECT_THAT(Server("status"), Ended(0, "SHA256:" + key));
    SetUpServer();
    EXPECT_THAT(Server("status"), Ended(0, "SHA256:" + key));  // which stays

    const std::string own = folder_.Path("own.pem");
    const std::string setup = "setup --certificate " + own;
    Must(
        test::RunProgram("", {"openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes", "-keyout",
                              own, "-out", own + ".crt", "-subj", "/CN=nas", "-days", "2"}));
    EXPECT_THAT(Server(setup), Ended(2, "must hold a certificate and its private key"));
    EXPECT_THAT(Server("setup --certificate /none"), Ended(2, "/none"));
    EXPECT_THAT(Server("status"), Ended(0, "SHA256:" + key));
    folder_.Write("own.pem", test::ReadFile(own) + test::ReadFile(own + ".crt"));
    Must(Server(setup));
    EXPECT_THAT(Server("status"), Ended(0, "older configuration"));
    StopServer();
    StartServer();
    EXPECT_NE(Fingerprint(), key);
    EXPECT_THAT(Server("status"), Ended(0, "SHA256:" + Fingerprint()));
}

}  // namespace

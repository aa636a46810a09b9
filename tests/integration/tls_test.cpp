// TLS channels against each other and against the openssl tool.
#include <openssl/bio.h>

#include "ZEL/channel.h"
#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "tests/integration/certificates.h"
#include "tests/support/log_capture.h"
#include "tests/support/sockets.h"
#include "tests/support/testing.h"

using namespace testing;
using ZEL::Channel;

namespace {

constexpr unsigned int kCapacity = 81920;

struct Files : test::Certificates {
    Files() {
        MakeSigned("nas",
                   "-subj /CN=nas.example -addext "
                   "'subjectAltName=IP:127.0.0.1,DNS:alt.example,DNS:*.wild.example'");
        MakeSigned("no_cn", "-subj /O=Nobody -addext subjectAltName=DNS:san.example");
        MakeSigned("no_san", "-subj /CN=cn.example");
        Make("self", "-subj /CN=nas.example");
        test::Run("openssl pkey -aes128 -passout pass:x -in " + Path("nas.key") + " -out " +
                  Path("locked.key"));
    }
};

class Tls : public testing::Test {
protected:
    Tls() { Use("nas", "nas.key"); }
    static std::string Path(const std::string& file) {
        static const Files files;
        return files.Path(file);
    }
    static void Use(const std::string& certificate, const std::string& key) {
        Channel::SetCERTPath(Path(certificate + ".pem"));
        Channel::SetPriKeyPath(Path(key));
        Channel::SetVerifyCAPath(Path("ca.pem"));
    }
};

// Another user of OpenSSL on this thread that does not look at its errors.
void LeaveAnError() {
    EXPECT_EQ(BIO_new_file("/nowhere", "r"), nullptr);
}

// Two channels on a socket pair, the second converted as the server by a thread.
struct TlsPair {
    TlsPair() {
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
        client.Open(fds[0], true);
        server.Open(fds[1], true);
    }
    int Convert() {
        LeaveAnError();
        std::thread other([this] { EXPECT_EQ(server.ConvertToSSLChannel(true), 0); });
        const int result = client.ConvertToSSLChannel(false);
        other.join();
        return result;
    }
    int fds[2];
    Channel client{kCapacity}, server{kCapacity};
};

}  // namespace

TEST_F(Tls, AnOpensslClientIsServed) {
    for (const std::string version : {"-tls1_2", "-tls1_3"}) {
        ZEL::IPCListener listener;
        const std::string port = std::to_string(listener.prepare(0));
        test::Command client(
            "printf hello | openssl s_client -quiet -verify_return_error -CAfile " +
            Path("ca.pem") + " -connect 127.0.0.1:" + port + " " + version);
        Channel channel(kCapacity);
        ASSERT_EQ(channel.Open(listener.accept(), true), 0);
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0) << version;
        EXPECT_EQ(channel.ConvertToSSLChannel(true), 0) << "again is nothing";
        char request[6] = "";
        EXPECT_EQ(channel.Read(request, 5), 0);
        EXPECT_STREQ(request, "hello");
        const std::string reply(kCapacity, 'r');  // in several records
        EXPECT_EQ(channel.Write(reply.data(), kCapacity), 0);
        channel.Close();
        int status = 1;
        EXPECT_THAT(client.Finish(status), HasSubstr(reply));
        EXPECT_EQ(status, 0);
    }
}

TEST_F(Tls, AnOpensslServerIsTalkedTo) {
    for (const std::string version : {"-tls1_2", "-tls1_3"}) {
        test::Command server("openssl s_server -accept 127.0.0.1:0 -naccept 1 -rev -cert " +
                             Path("nas.pem") + " -key " + Path("nas.key") + " " + version);
        std::string line = "first";
        while (line.find("ACCEPT 127.0.0.1:") != 0) {
            ASSERT_FALSE(line.empty());
            line = server.ReadLine();
        }
        Channel channel(kCapacity);
        channel.SetAllowUntrust(false);
        channel.SetSSLHostname("a.wild.example");
        ASSERT_EQ(channel.Open("127.0.0.1", stoi(line.substr(line.rfind(':') + 1))), 0);
        ASSERT_EQ(channel.ConvertToSSLChannel(false), 0) << version;
        char reply[8] = "";
        ASSERT_EQ(channel.Write("drawer\n", 7), 0);
        ASSERT_EQ(channel.FlushWrite(0), 0);
        ASSERT_EQ(channel.Read(reply, 7), 0);
        EXPECT_STREQ(reply, "reward\n");
    }
}

TEST_F(Tls, TheServersCertificateDecides) {
    const struct {
        const char *certificate, *host;
        bool allow_untrusted, verified;
    } cases[] = {
        {"nas", "", false, true},
        {"nas", "NAS.example", false, true},
        {"nas", "alt.example", false, true},
        {"nas", "wild.example", false, true},
        {"nas", "a.b.wild.example", false, false},
        {"nas", "127.0.0.1", false, false},
        {"no_cn", "san.example", false, true},
        {"no_san", "cn.example", false, true},
        {"no_san", "san.example", false, false},
        {"self", "", false, false},
        {"self", "other.example", true, true},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.certificate) + " " + c.host);
        Use(c.certificate, std::string(c.certificate) + ".key");
        TlsPair pair;
        pair.client.SetAllowUntrust(c.allow_untrusted);
        pair.client.SetSSLHostname(c.host);
        EXPECT_EQ(pair.Convert(), c.verified ? 0 : ZEL::RESULT_CERTIFICATE);
    }
}

TEST_F(Tls, SetUpFailuresLeaveAPlainChannel) {
    const struct {
        bool server;
        const char *certificate, *key, *log;
    } cases[] = {
        {true, "missing", "nas.key", "Install certificate failed\n"},
        {true, "nas", "self.key", "Install private key failed\n"},
        {true, "nas", "locked.key", "Install private key failed\n"},
        {false, "nas", "nas.key", "SSL_CTX_load_verify_locations(/nowhere) failed\n"},
    };
    for (const auto& c : cases) {
        Use(c.certificate, c.key);
        Channel::SetVerifyCAPath("/nowhere");
        test::RawPeer peer;
        peer.channel.SetAllowUntrust(false);
        const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
        EXPECT_EQ(peer.channel.ConvertToSSLChannel(c.server), ZEL::RESULT_IO);
        EXPECT_THAT(log.Text(), HasSubstr(c.log));
        peer.channel.WriteByte('p');
        peer.channel.Close();
        EXPECT_EQ(peer.Take(), "p");
    }
}

TEST_F(Tls, HandshakesWithStrangersFail) {
    for (const bool server : {false, true}) {
        test::RawPeer garbage, gone, silent, slow;
        garbage.Send("GET / HTTP/1.0\r\n\r\n");
        gone.Close();
        silent.channel.SetTimeout(1);
        int flag = 1;  // is not looked at
        silent.channel.SetFlag(&flag);
        const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
        EXPECT_EQ(garbage.channel.ConvertToSSLChannel(server), ZEL::RESULT_IO);
        EXPECT_EQ(gone.channel.ConvertToSSLChannel(server), ZEL::RESULT_IO);
        EXPECT_EQ(silent.channel.ConvertToSSLChannel(server), ZEL::RESULT_TIMEOUT);
        slow.channel.SetTimeout(1);
        std::thread trickle([&] {
            slow.Send("\x16\x03\x01\x40");
            // A byte of one long message from time to time.
            for (int i = 0; i < 20 && send(slow.fd, "\x01", 1, MSG_NOSIGNAL) == 1; ++i) {
                usleep(100'000);
            }
            slow.Close();
        });
        EXPECT_EQ(slow.channel.ConvertToSSLChannel(server), ZEL::RESULT_TIMEOUT);
        slow.channel.Close();
        trickle.join();
        EXPECT_THAT(log.Text(), AllOf(HasSubstr("SSLHandshake: SSL fatel error code: 1\n"),
                                      HasSubstr("timed out during connect (1 seconds), abort")));
    }
}

TEST_F(Tls, AnInterruptedFlushGoesOnWhereItStopped) {
    TlsPair pair;
    ASSERT_EQ(pair.Convert(), 0);
    std::string sent(3000000, 0), received = sent;
    for (size_t i = 0; i < sent.size(); ++i) {
        sent[i] = static_cast<char>(i * 2654435761U >> 13);
    }
    const int size = 1;  // so little that each record leaves in parts
    setsockopt(pair.fds[0], SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
    int flag = 0;
    pair.client.SetFlag(&flag);
    pair.client.SetTimeout(1);
    // Until the socket is full: the flush stops in the middle of a record.
    size_t written = 0;
    LeaveAnError();
    while (pair.client.Write(&sent[written], 60000) == 0) {
        written += 60000;
        ASSERT_LT(written, sent.size());
        LeaveAnError();
    }
    flag = 1;
    EXPECT_EQ(pair.client.FlushWrite(0), ZEL::RESULT_INTERRUPTED);
    flag = 0;
    std::thread reader([&] {
        for (size_t at = 0; at < received.size(); at += 100000) {
            LeaveAnError();
            EXPECT_EQ(pair.server.Read(&received[at], 100000), 0);
        }
    });
    for (; written < sent.size(); written += 60000) {
        EXPECT_EQ(pair.client.Write(&sent[written], 60000), 0);
    }
    pair.client.Close();
    reader.join();
    EXPECT_TRUE(received == sent);
    char byte;
    EXPECT_EQ(pair.server.Read(&byte, 1), ZEL::RESULT_IO) << "the client has said goodbye";
}

TEST_F(Tls, APeerThatDiesRaisesNoSignal) {
    TlsPair pair;
    ASSERT_EQ(pair.Convert(), 0);
    shutdown(pair.fds[1], SHUT_RDWR);  // no farewell in TLS
    char byte;
    EXPECT_EQ(pair.client.Read(&byte, 1), ZEL::RESULT_IO);
    for (Channel* channel : {&pair.client, &pair.server}) {
        channel->WriteByte(1);
        EXPECT_LT(channel->FlushWrite(0), 0);
        channel->Close();
    }
}

// TLS channels against each other and against the openssl tool.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <openssl/bio.h>
#include <sys/socket.h>

#include <thread>

#include "ZEL/channel.h"
#include "ZEL/ipc.h"
#include "ZEL/log.h"
#include "tests/integration/certificates.h"
#include "tests/support/log_capture.h"
#include "tests/support/sockets.h"

using testing::HasSubstr;
using ZEL::Channel;

namespace {

constexpr unsigned int kCapacity = 81920;

class Tls : public testing::Test {
protected:
    static void SetUpTestSuite() {
        files = new test::Certificates();
        files->MakeSigned("nas",
                          {"-subj", "/CN=nas.example", "-addext",
                           "subjectAltName=IP:127.0.0.1,DNS:alt.example,DNS:*.wild.example"});
        files->MakeSigned("no_cn",
                          {"-subj", "/O=Nobody", "-addext", "subjectAltName=DNS:san.example"});
        files->MakeSigned("no_san", {"-subj", "/CN=cn.example"});
        files->Make("self", {"-subj", "/CN=nas.example"});
        test::Run({"openssl", "genrsa", "-out", files->Path("rsa.key"), "2048"});
        test::Run({"openssl", "pkey", "-in", files->Path("nas.key"), "-aes128", "-passout",
                   "pass:x", "-out", files->Path("locked.key")});
    }
    static void TearDownTestSuite() {
        delete files;
        files = nullptr;
    }
    void SetUp() override { Use("nas", "nas.key"); }

    static void Use(const std::string& certificate, const std::string& key) {
        Channel::SetCERTPath(files->Path(certificate + ".pem"));
        Channel::SetPriKeyPath(files->Path(key));
        Channel::SetVerifyCAPath(files->Path("ca.pem"));
    }

    static test::Certificates* files;
};

test::Certificates* Tls::files;

// Another user of OpenSSL on this thread that does not look at its errors.
void LeaveAnError() {
    EXPECT_EQ(BIO_new_file("/nowhere", "r"), nullptr);
}

// Two channels on a socket pair, the second converted as the server by a thread.
struct TlsPair {
    TlsPair() : client(kCapacity), server(kCapacity) {
        int fds[2];
        EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
        client.Open(fds[0], true);
        server.Open(fds[1], true);
        client_fd = fds[0];
        server_fd = fds[1];
    }
    int Convert() {
        LeaveAnError();
        std::thread other([this] { server_result = server.ConvertToSSLChannel(true); });
        const int result = client.ConvertToSSLChannel(false);
        other.join();
        return result;
    }
    Channel client, server;
    int server_result = 1, client_fd = -1, server_fd = -1;
};

std::string Pattern(size_t size) {
    std::string pattern(size, 0);
    for (size_t i = 0; i < size; ++i) {
        pattern[i] = static_cast<char>(i * 2654435761U >> 13);
    }
    return pattern;
}

}  // namespace

TEST_F(Tls, AnOpensslClientIsServed) {
    for (const char* version : {"-tls1_2", "-tls1_3"}) {
        ZEL::IPCListener listener;
        const int port = listener.prepare(0);
        test::Child client({"openssl", "s_client", "-connect", "127.0.0.1:" + std::to_string(port),
                            "-quiet", "-verify_return_error", "-CAfile", files->Path("ca.pem"),
                            version});
        Channel channel(kCapacity);
        ASSERT_EQ(channel.Open(listener.accept(), true), 0);
        ASSERT_EQ(channel.ConvertToSSLChannel(true), 0) << version;
        EXPECT_EQ(channel.ConvertToSSLChannel(true), 0) << "again is nothing";
        client.Write("hello");
        char request[6] = "";
        EXPECT_EQ(channel.Read(request, 5), 0);
        EXPECT_STREQ(request, "hello");
        const std::string reply = Pattern(500000);
        for (size_t at = 0; at < reply.size(); at += 50000) {
            EXPECT_EQ(channel.Write(&reply[at], 50000), 0);
        }
        std::string ip;
        int peer_port = 0;
        EXPECT_EQ(channel.GetPeerInfo(ip, peer_port), 0);
        EXPECT_EQ(ip, "127.0.0.1");
        std::thread closer([&channel] { channel.Close(); });
        std::string output;
        EXPECT_EQ(client.Finish(output), 0);
        closer.join();
        EXPECT_THAT(output, testing::EndsWith(reply.substr(reply.size() - 1000)));
        EXPECT_GE(output.size(), reply.size());
    }
}

TEST_F(Tls, AnOpensslServerIsTalkedTo) {
    for (const char* version : {"-tls1_2", "-tls1_3"}) {
        test::Child server({"openssl", "s_server", "-accept", "127.0.0.1:0", "-rev", "-cert",
                            files->Path("nas.pem"), "-key", files->Path("nas.key"), version});
        std::string line;
        while (line.find("ACCEPT 127.0.0.1:") != 0) {
            line = server.ReadLine();
            ASSERT_FALSE(line.empty());
        }
        Channel channel(kCapacity);
        channel.SetAllowUntrust(false);
        channel.SetSSLHostname("a.wild.example");
        ASSERT_EQ(channel.Open("127.0.0.1", std::stoi(line.substr(line.rfind(':') + 1))), 0);
        const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
        ASSERT_EQ(channel.ConvertToSSLChannel(false), 0) << version << log.Text();
        for (const char* word : {"drawer\n", "abc\n"}) {
            ASSERT_EQ(channel.Write(word, static_cast<unsigned int>(strlen(word))), 0);
            ASSERT_EQ(channel.FlushWrite(0), 0);
            std::string reply(strlen(word), 0);
            ASSERT_EQ(channel.Read(&reply[0], static_cast<unsigned int>(reply.size())), 0);
            EXPECT_EQ(reply, std::string(word) == "abc\n" ? "cba\n" : "reward\n");
        }
    }
}

TEST_F(Tls, TheServersCertificateDecides) {
    const struct {
        const char* certificate;
        bool allow_untrusted;
        const char* host;
        int result;
    } cases[] = {
        {"nas", false, "", 0},
        {"nas", false, "NAS.example", 0},
        {"nas", false, "alt.example", 0},
        {"nas", false, "a.wild.example", 0},
        {"nas", false, "wild.example", 0},
        {"nas", false, "a.b.wild.example", ZEL::RESULT_CERTIFICATE},
        {"nas", false, "127.0.0.1", ZEL::RESULT_CERTIFICATE},
        {"no_cn", false, "san.example", 0},
        {"no_cn", false, "nobody", ZEL::RESULT_CERTIFICATE},
        {"no_san", false, "cn.example", 0},
        {"no_san", false, "san.example", ZEL::RESULT_CERTIFICATE},
        {"self", false, "", ZEL::RESULT_CERTIFICATE},
        {"self", true, "other.example", 0},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(std::string(c.certificate) + " " + c.host);
        Use(c.certificate, std::string(c.certificate) + ".key");
        TlsPair pair;
        pair.client.SetAllowUntrust(c.allow_untrusted);
        pair.client.SetSSLHostname(c.host);
        const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
        EXPECT_EQ(pair.Convert(), c.result);
        EXPECT_EQ(pair.server_result, 0);
        EXPECT_EQ(log.Text().find("ConvertToSSLChannel: Verify Fail!\n") != std::string::npos,
                  c.result != 0);
        EXPECT_FALSE(pair.client.IsClosed());
    }
}

TEST_F(Tls, SetUpFailuresLeaveAPlainChannel) {
    const struct {
        bool server;
        const char *certificate, *key, *log;
    } cases[] = {
        {true, "missing", "nas.key", "Install certificate failed\n"},
        {true, "nas", "missing.key", "Install private key failed\n"},
        {true, "nas", "self.key", "Install private key failed\n"},
        {true, "nas", "rsa.key", "Open: init ssl private key failed\n"},
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
        EXPECT_THAT(log.Text(), testing::EndsWith("Open: init ssl failed\n"));
        peer.channel.WriteByte('p');
        peer.channel.Close();
        EXPECT_EQ(peer.Take(), "p");
        EXPECT_EQ(peer.channel.ConvertToSSLChannel(c.server), ZEL::RESULT_IO) << "closed";
    }
}

TEST_F(Tls, HandshakesWithStrangersFail) {
    for (const bool server : {false, true}) {
        test::RawPeer garbage, gone, silent;
        garbage.Send("GET / HTTP/1.0\r\n\r\n");
        gone.Close();
        const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
        EXPECT_EQ(garbage.channel.ConvertToSSLChannel(server), ZEL::RESULT_IO);
        EXPECT_THAT(log.Text(), HasSubstr("SSLHandshake: SSL fatel error code: 1\n"
                                          "[WARNING] ZEL/channel(N): ssl-errors: error:"));
        EXPECT_EQ(gone.channel.ConvertToSSLChannel(server), ZEL::RESULT_IO);
        silent.channel.SetTimeout(1);
        int flag = 1;  // is not looked at
        silent.channel.SetFlag(&flag);
        EXPECT_EQ(silent.channel.ConvertToSSLChannel(server), ZEL::RESULT_TIMEOUT);
        EXPECT_THAT(log.Text(),
                    HasSubstr("SSLHandshake: timed out during connect (1 seconds), abort "
                              "anyway\n"));
    }
}

TEST_F(Tls, AnInterruptedFlushGoesOnWhereItStopped) {
    TlsPair pair;
    ASSERT_EQ(pair.Convert(), 0);
    const std::string sent = Pattern(3000000);
    const int size = 1;  // so little that each record leaves in parts
    setsockopt(pair.client_fd, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
    int flag = 0;
    pair.client.SetFlag(&flag);
    pair.client.SetTimeout(1);
    // Until the socket is full: the flush stops in the middle of a record.
    size_t written = 0;
    int result = 0;
    while (result == 0) {
        ASSERT_LT(written, sent.size());
        LeaveAnError();
        result = pair.client.Write(&sent[written], 60000);
        written += result == 0 ? 60000 : 0;
    }
    EXPECT_EQ(result, ZEL::RESULT_TIMEOUT);
    flag = 1;
    EXPECT_EQ(pair.client.FlushWrite(0), ZEL::RESULT_INTERRUPTED);
    flag = 0;
    std::string received(sent.size(), 0);
    std::thread reader([&] {
        for (size_t at = 0; at < received.size(); at += 100000) {
            LeaveAnError();
            EXPECT_EQ(pair.server.Read(&received[at], 100000), 0);
        }
    });
    for (; written < sent.size(); written += 60000) {
        ASSERT_EQ(pair.client.Write(&sent[written], 60000), 0);
    }
    EXPECT_EQ(pair.client.FlushWrite(0), 0);
    reader.join();
    EXPECT_TRUE(received == sent);
    pair.client.Close();
    char byte;
    EXPECT_EQ(pair.server.Read(&byte, 1), ZEL::RESULT_IO) << "the client has said goodbye";
}

TEST_F(Tls, APeerThatDiesRaisesNoSignal) {
    TlsPair pair;
    ASSERT_EQ(pair.Convert(), 0);
    shutdown(pair.server_fd, SHUT_RDWR);  // no farewell in TLS
    char byte;
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    EXPECT_EQ(pair.client.Read(&byte, 1), ZEL::RESULT_IO);
    pair.client.WriteByte(1);
    EXPECT_LT(pair.client.FlushWrite(0), 0);
    pair.client.Close();
    pair.server.WriteByte(1);
    EXPECT_EQ(pair.server.FlushWrite(0), ZEL::RESULT_SYSTEM);
    EXPECT_THAT(log.Text(),
                HasSubstr("syscall error: n = -1, ssl_ret = 5, errno = 32, err = Broken "
                          "pipe\n"));
    pair.server.Close();
}

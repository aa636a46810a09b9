// connect HOST PORT SECONDS SILENCE FINGERPRINT [IGNORED...]: what rsync runs in the place of a
// remote shell, to reach a daemon behind TLS. Connects, makes sure within so many seconds that the
// server has the key with this fingerprint, and relays between the server and standard input and
// output until the connection ends or nothing has moved for about SILENCE seconds (0: for ever).
// rsync adds what a remote shell would run there.
//
// connect --show-key HOST PORT SECONDS: prints the fingerprint of the server's key.
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <climits>
#include <cstdio>
#include <cstring>
#include <string>

#include "base/text.h"
#include "platform/tarqrsync/helpers/relay.h"
#include "platform/tarqrsync/helpers/tls_connection.h"

namespace {

using namespace tarqrsync;

constexpr int kUsage = 2;
constexpr int kMaxSeconds = 86400;
constexpr int kMaxPort = 65535;
// Words of each form, with the program's name.
constexpr int kRelayWords = 6;
constexpr int kShowWords = 5;

int Usage() {
    fputs(
        "usage: connect HOST PORT SECONDS SILENCE FINGERPRINT [IGNORED...]\n"
        "       connect --show-key HOST PORT SECONDS\n",
        stderr);
    return kUsage;
}

// Says that the time is up, wherever the program waits: for a name server, for a connection, for
// the next byte of a handshake.
void EndTooLate(int) {
    constexpr char kText[] = "connect: timed out\n";
    [[maybe_unused]] const ssize_t told = write(STDERR_FILENO, kText, sizeof kText - 1);
    _exit(1);
}

}  // namespace

int main(int argc, char** argv) {
    const bool show = argc == kShowWords && strcmp(argv[1], "--show-key") == 0;
    if (!show && argc < kRelayWords) {
        return Usage();
    }
    const char* const* const words = argv + (show ? 2 : 1);
    const auto port = base::ParseNumber(words[1], kMaxPort);
    const auto seconds = base::ParseNumber(words[2], kMaxSeconds);
    const auto silence = base::ParseNumber(show ? "0" : words[3], INT_MAX);
    if (!port || *port == 0 || !seconds || *seconds == 0 || !silence) {
        return Usage();
    }
    // Until the relay begins, which then looks after that by itself.
    prctl(PR_SET_PDEATHSIG, SIGTERM);
    signal(SIGPIPE, SIG_IGN);
    signal(SIGALRM, EndTooLate);
    alarm(static_cast<unsigned int>(*seconds));
    try {
        TlsConnection server(words[0], words[1], static_cast<int>(*seconds));
        const std::string key = server.KeyFingerprint();
        if (show) {
            puts(key.c_str());
            return 0;
        }
        if (key != words[4]) {
            throw ConnectError("key " + key + " is not " + words[4]);
        }
        alarm(0);
        try {
            Relay(server, std::chrono::seconds(static_cast<int>(*silence)));
        } catch (const ConnectError& error) {
            // Whether all had been said by then, rsync knows: its own end is the run's.
            fprintf(stderr, "connect: %s\n", error.what());
        }
        _exit(0);  // what OpenSSL would clear up goes with the process
    } catch (const ConnectError& error) {
        fprintf(stderr, "connect: %s\n", error.what());
        return 1;
    }
}

#include "programs/common/failure.h"
#include "programs/zelctl/declare.h"
#include "programs/zelctl/server/trust.h"

namespace zelctl {

void DeclareTrust(CLI::App& trust) {
    static std::string host;
    static TrustWish wish;
    static bool ssh = false;
    static bool list = false;
    static bool forget = false;
    static bool as_json = false;
    trust.add_option("host", host,
                     "The server, as tasks name it; HOST:PORT where it has another port");
    AddTrustOptions(trust, wish);
    trust.add_flag("--ssh", ssh, "Through an ssh login, known by the ssh server's host key");
    CLI::Option* const listing =
        trust.add_flag("--list", list, "List the servers that are trusted");
    CLI::Option* const forgetting = trust.add_flag(
        "--forget", forget, "Take the server out; tasks that name it are asked about again");
    trust.add_flag("--json", as_json, "Write JSON, for programs")->needs(listing);
    forgetting->excludes(listing);
    trust.footer(
        "A server is known by its key: with TLS the one that 'zel_server status' prints\n"
        "there. Without --fingerprint it is shown here, and you are asked.");
    trust.callback([] {
        if (list) {
            ListTrust(as_json);
            return;
        }
        if (host.empty()) {
            throw programs::Failure(programs::FailureKind::kUsage,
                                    "no server is given: zelctl trust HOST, or --list");
        }
        if (forget) {
            ForgetTrust(host);
            return;
        }
        if (ssh) {
            wish.ssh = true;
        }
        Trust(host, wish);
    });
}

}  // namespace zelctl

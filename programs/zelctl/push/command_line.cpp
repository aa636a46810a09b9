#include <utility>

#include "programs/common/task_fields.h"
#include "programs/zelctl/declare.h"
#include "programs/zelctl/push/push.h"

namespace zelctl {

void DeclarePair(CLI::App& pair) {
    static ConnectionOptions connection;
    static std::vector<std::string> shares;
    pair.require_subcommand(1);
    CLI::App* const check =
        pair.add_subcommand("check", "Ask whether the server would take shares from this client");
    check->add_option("shares", shares, "The shares")->required();
    connection.AddTo(check);
    check->callback([] { CheckPairing(connection, shares); });
}

void DeclarePush(CLI::App& push) {
    static PushOptions options;
    push.add_option("shares", options.shares, "The shares")->required();
    options.connection.AddTo(&push, {"max_bandwidth", "exclude", "brake"});
    push.add_option("--path", options.path, "Only this path of the share, beginning with /")
        ->check([](const std::string& path) {
            return path.empty() || path.front() != '/'
                       ? std::string("a path of a share begins with /")
                       : "";
        });
    push.add_flag("-n,--dry-run", options.dry_run, "Only list what would be sent and deleted");
    push.add_flag("--confirm", options.confirmed,
                  "Go on however much is lost of a copy; else it is asked, or refused where nobody "
                  "can be asked");
    push.add_flag("-q,--quiet", options.quiet, "Say nothing but errors");
    push.callback([] {
        options.excludes = programs::TextsOf(std::as_const(options.connection.said)["exclude"]);
        Push(options);
    });
}

}  // namespace zelctl

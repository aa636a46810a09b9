// What ssh runs for a password: prints the line of the file that TARQRSYNC_SECRET names, which no
// folder has (see platform/tarqrsync/secret_file.h).
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <string>

#include "base/whole_file.h"

int main() {
    constexpr size_t kMaxBytes = 4096;
    const char* const path = getenv("TARQRSYNC_SECRET");
    const std::optional<std::string> secret =
        path == nullptr ? std::nullopt : base::ReadFile(path, kMaxBytes);
    if (!secret) {
        perror("askpass: cannot read the password");
        return 1;
    }
    return fputs(secret->c_str(), stdout) < 0 || fflush(stdout) != 0 ? 1 : 0;
}

#pragma once

#include <string>

#include "tests/integration/command.h"
#include "tests/support/temp_root.h"

namespace test {

/// Certificates and keys of a CA of their own, made with the openssl tool.
class Certificates {
public:
    Certificates() { Make("ca", "-subj '/CN=Test CA'"); }

    /// A certificate `name`.pem with its key `name`.key (no passphrase), signed by itself or by the
    /// CA.
    void Make(const std::string& name, const std::string& options) const {
        Run("openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -days 2 " +
            options + " -keyout " + Path(name + ".key") + " -out " + Path(name + ".pem"));
    }
    void MakeSigned(const std::string& name, const std::string& options) const {
        Make(name, "-CA " + Path("ca.pem") + " -CAkey " + Path("ca.key") + " " + options);
    }
    std::string Path(const std::string& file) const { return folder_.Path(file); }

private:
    TempFolder folder_;
};

}  // namespace test

#pragma once

#include <string>
#include <vector>

#include "tests/integration/child.h"
#include "tests/support/temp_root.h"

namespace test {

/// Certificates and keys of a CA of their own, made with the openssl tool.
class Certificates {
public:
    Certificates() { Make("ca", {"-subj", "/CN=Test CA"}); }

    /// A certificate `name`.pem with its key `name`.key (no passphrase), signed by the CA or by
    /// itself.
    void MakeSigned(const std::string& name, std::vector<std::string> more) const {
        more.insert(more.end(), {"-CA", Path("ca.pem"), "-CAkey", Path("ca.key")});
        Make(name, more);
    }
    void Make(const std::string& name, const std::vector<std::string>& more) const {
        std::vector<std::string> arguments = {"openssl",
                                              "req",
                                              "-x509",
                                              "-newkey",
                                              "ec",
                                              "-pkeyopt",
                                              "ec_paramgen_curve:P-256",
                                              "-nodes",
                                              "-days",
                                              "2",
                                              "-keyout",
                                              Path(name + ".key"),
                                              "-out",
                                              Path(name + ".pem")};
        arguments.insert(arguments.end(), more.begin(), more.end());
        Run(arguments);
    }
    std::string Path(const std::string& file) const { return folder_.Path(file); }

private:
    TempFolder folder_;
};

}  // namespace test

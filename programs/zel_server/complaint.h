// What the admin's commands say when they cannot do what they are asked, and their exit codes.
#pragma once

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <string>

namespace zel_server {

constexpr int kExitOk = 0;
constexpr int kExitFailed = 1;
constexpr int kExitUsage = 2;

inline constexpr char kNotSetUp[] = "not set up: run 'zel_server setup --storage FOLDER'";

/// Says it on standard error; gives kExitFailed.
inline int Complain(const std::string& message) {
    fprintf(stderr, "zel_server: %s\n", message.c_str());
    return kExitFailed;
}

/// The same, with the reason of errno behind it.
inline int ComplainErrno(const std::string& what) {
    return Complain(what + ": " + strerror(errno));
}

}  // namespace zel_server

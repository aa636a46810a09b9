// What `serve` and those who ask it say to each other.
#pragma once

#include <cstddef>

namespace zel_server {

/// The maximum length of a request to the daemon, and of its answer, in bytes.
inline constexpr size_t kMaxControlMessage = 1024;
/// The daemon's answers to a log-in.
inline constexpr char kAdmitted[] = "yes";
inline constexpr char kTooMany[] = "too many";
inline constexpr char kNotServed[] = "no";

}  // namespace zel_server

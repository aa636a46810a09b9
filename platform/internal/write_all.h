#pragma once

#include <string>

namespace tarq_internal {

/// Writes all of `bytes` to the open descriptor `fd`. False with errno set when it cannot.
bool WriteAll(int fd, const std::string& bytes);

}  // namespace tarq_internal

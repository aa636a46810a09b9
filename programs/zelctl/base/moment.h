#pragma once

#include <cstdint>
#include <optional>
#include <string>

namespace zelctl {

/// "YYYY-MM-DD HH:MM" or "YYYY-MM-DD HH:MM:SS" in local time, as seconds since the epoch; nothing
/// for any other text.
std::optional<int64_t> ParseMoment(const std::string& text);

}  // namespace zelctl

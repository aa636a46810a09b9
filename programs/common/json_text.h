#pragma once

#include <nlohmann/json.hpp>
#include <string>

#include "programs/common/text.h"

namespace programs {

/// JSON as the programs print it: indented, with invalid UTF-8 replaced, and safe on a terminal.
inline std::string JsonText(const nlohmann::ordered_json& json) {
    return SafeJson(json.dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}

}  // namespace programs

#pragma once

#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>

namespace tarqcore {

/// `format` with its "%s" replaced by the arguments in turn and "%%" by a per cent sign. Nothing
/// when it holds any other conversion, or not as many "%s" as there are arguments: a format may
/// come from outside.
std::optional<std::string> FormatStrings(std::string_view format,
                                         std::initializer_list<std::string_view> arguments);

}  // namespace tarqcore

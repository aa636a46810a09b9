#include "base/section_view.h"

#include "base/text.h"

namespace base {
namespace {

std::string_view TrimmedLine(std::string_view text) {
    return Trimmed(text, " \t\r");
}

}  // namespace

std::optional<KeyLine> ParseKeyLine(std::string_view line) {
    const std::string_view trimmed = TrimmedLine(line);
    const size_t equals = trimmed.find('=');
    if (equals == std::string_view::npos || trimmed.front() == '#' || trimmed.front() == '[' ||
        trimmed.find('\0') != std::string_view::npos) {
        return std::nullopt;
    }
    const std::string_view key = TrimmedLine(trimmed.substr(0, equals));
    if (key.empty() || key.find('"') != std::string_view::npos) {
        return std::nullopt;
    }
    std::string_view value = TrimmedLine(trimmed.substr(equals + 1));
    if (value.size() >= 2 && value.front() == '"') {
        const size_t last_quote = value.rfind('"');
        if (last_quote > 0) {
            value = value.substr(1, last_quote - 1);
        }
    }
    const auto indent = static_cast<size_t>(trimmed.data() - line.data());
    return KeyLine{line.substr(0, indent), key, value};
}

bool TakeLine(std::string_view& text, std::string_view& line) {
    if (text.empty()) {
        return false;
    }
    const size_t line_break = text.find('\n');
    line = text.substr(0, line_break);
    text.remove_prefix(line_break == std::string_view::npos ? text.size() : line_break + 1);
    return true;
}

}  // namespace base

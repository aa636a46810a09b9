// The lines of section files: "[name]" headers, key="value" lines below them, "#" comments.
#pragma once

#include <optional>
#include <string_view>

namespace base {

/// One key="value" line. The views point into the line.
struct KeyLine {
    std::string_view indent;  ///< the blanks in front of the key
    std::string_view key;
    std::string_view value;
};

/// Parses a line without its line break. Nothing for a comment, a header or a line without a key.
///
/// Blanks (space, tab, carriage return) around the line, the key and the value are ignored. The
/// value runs from its first quote to the last quote of the line, so that quotes inside it need no
/// escape; a value that does not begin with a quote, or has only that one, is taken as it is. A
/// line with a NUL in it, or whose key holds a quote or begins with "[", has no key.
std::optional<KeyLine> ParseKeyLine(std::string_view line);

/// Takes the first line, without its line break, off `text`. False when there is no text left.
bool TakeLine(std::string_view& text, std::string_view& line);

/// Some editors put this in front of a text; it is ignored.
constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

}  // namespace base

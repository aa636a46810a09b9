// The lines of section files: "[name]" headers, key="value" lines below them, "#" comments.
#pragma once

#include <optional>
#include <string_view>

namespace base {

/// One key="value" line. The views lie in the line.
struct KeyLine {
    std::string_view indent;  ///< the blanks in front of the key
    std::string_view key;
    std::string_view value;
};

/// What a line says, its line break taken off. Nothing for a comment, a header and whatever has no
/// key:
///  - blanks (space, tab, carriage return) around the line, the key and the value do not count;
///  - the value runs from its first quote to the last quote of the line, so that quotes inside it
///  need no escape;
///    a value that does not begin with a quote, or has only that one, counts as it stands;
///  - a line with a NUL in it, or whose key holds a quote or begins with "[", is none of ours.
std::optional<KeyLine> ParseKeyLine(std::string_view line);

/// Takes the first line, without its line break, off `text`. False when there is no text left.
bool TakeLine(std::string_view& text, std::string_view& line);

/// What some editors put in front of a text; it does not count.
constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

}  // namespace base

#include "platform/tarqcore/section_edit.h"

#include <algorithm>

#include "base/section_view.h"
#include "platform/tarqcore/format_string.h"

namespace tarqcore {
namespace {

using base::KeyLine;
using base::ParseKeyLine;
using base::TakeLine;

constexpr std::string_view kLineBreaks = "\n\r";

bool HasAny(std::string_view text, std::string_view characters) {
    return text.find_first_of(characters) != std::string_view::npos;
}

bool IsBlankOrComment(std::string_view line) {
    const size_t first = line.find_first_not_of(" \t\r");
    return first == std::string_view::npos || line[first] == '#';
}

std::string SectionText(std::string_view name, const std::vector<NewLine>& lines) {
    std::string text = "[";
    text.append(name).append("]\n");
    for (const NewLine& line : lines) {
        text += line.text;
    }
    return text;
}

/// Where the section's own lines end: comments and blank lines behind them belong to what follows.
size_t OwnEnd(const SectionImage& image, const Section& section) {
    std::string_view body = image.Body(section);
    size_t end = section.end - body.size();
    for (std::string_view line; TakeLine(body, line);) {
        if (!IsBlankOrComment(line)) {
            end = section.end - body.size();
        }
    }
    return end;
}

/// Whether `text` is one line that is read back as that key and value. This is the only check of
/// keys, values and line formats, except for carriage returns.
bool ReadsBack(std::string_view text, std::string_view key, std::string_view value) {
    if (text.empty() || text.find('\n') != text.size() - 1) {
        return false;
    }
    text.remove_suffix(1);
    const std::optional<KeyLine> read = ParseKeyLine(text);
    return read && read->key == key && read->value == value;
}

const NewLine* FindLine(const std::vector<NewLine>& lines, std::string_view key) {
    const auto found = std::lower_bound(
        lines.begin(), lines.end(), key,
        [](const NewLine& line, std::string_view wanted) { return line.key < wanted; });
    return found != lines.end() && found->key == key ? &*found : nullptr;
}

}  // namespace

std::optional<std::vector<NewLine>> MakeLines(std::string_view section, KAPICSzHash values,
                                              std::string_view line_format) {
    if (HasAny(section, kLineBreaks) || HasAny(section, "]")) {
        return std::nullopt;
    }
    std::vector<NewLine> lines;
    const char* key = nullptr;
    const char* value = nullptr;
    for (int position = 0; KAPICSzHashNext(values, &position, &key, &value) != 0;) {
        if (HasAny(key, kLineBreaks) || HasAny(value, kLineBreaks)) {
            return std::nullopt;
        }
        std::optional<std::string> text = FormatStrings(line_format, {key, value});
        if (!text || !ReadsBack(*text, key, value)) {
            return std::nullopt;
        }
        lines.push_back({key, std::move(*text)});
    }
    return lines;
}

NewText WithSectionAdded(const SectionImage& image, std::string_view name,
                         const std::vector<NewLine>& lines) {
    const std::string_view text = image.Text();
    NewText result;
    if (!text.empty() && text.back() != '\n') {
        result.added = "\n";
    }
    result.before = text;
    result.added += SectionText(name, lines);
    return result;
}

NewText WithSectionReplaced(const SectionImage& image, std::string_view name,
                            const std::vector<NewLine>& lines) {
    const std::optional<Section> section = image.FindFrom(name, 0);
    if (!section) {
        return WithSectionAdded(image, name, lines);
    }
    NewText result = WithSectionRemoved(image, *section);
    result.added = SectionText(name, lines);
    return result;
}

NewText WithKeysSet(const SectionImage& image, const Section& section,
                    const std::vector<NewLine>& lines) {
    const std::string_view text = image.Text();
    std::string_view rest = text.substr(section.begin, OwnEnd(image, section) - section.begin);

    NewText result;
    result.before = text.substr(0, section.begin);
    result.after = {text.substr(section.begin + rest.size())};
    std::vector<bool> written(lines.size());
    std::string_view line;
    TakeLine(rest, line);
    result.added.append(line).append("\n");
    while (TakeLine(rest, line)) {
        const std::optional<KeyLine> old = ParseKeyLine(line);
        const NewLine* replacement = old ? FindLine(lines, old->key) : nullptr;
        if (replacement == nullptr) {
            result.added.append(line).append("\n");
            continue;
        }
        // A second line of the key goes: its value was never read.
        const auto at = static_cast<size_t>(replacement - lines.data());
        if (!written[at]) {
            result.added.append(old->indent).append(replacement->text);
            written[at] = true;
        }
    }
    for (size_t at = 0; at < lines.size(); ++at) {
        if (!written[at]) {
            result.added += lines[at].text;
        }
    }
    return result;
}

NewText WithSectionRemoved(const SectionImage& image, Section section) {
    const std::string_view text = image.Text();
    const std::string_view name = image.Name(section);
    NewText result;
    result.before = text.substr(0, section.begin);
    size_t from = OwnEnd(image, section);
    while (const std::optional<Section> next = image.FindFrom(name, section.end)) {
        section = *next;
        result.after.push_back(text.substr(from, section.begin - from));
        from = OwnEnd(image, section);
    }
    result.after.push_back(text.substr(from));
    return result;
}

}  // namespace tarqcore

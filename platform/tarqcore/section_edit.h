#pragma once

#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/tarqcore/section_image.h"
#include "tarq/core.h"

namespace tarqcore {

/// The lines of one section as they are to be written: key and value as they read back, line with
/// its line break.
struct NewLine {
    std::string_view key;  ///< the hash's own
    std::string text;
};

/// The new lines of a hash. Nothing when the section's name, a key, a value or the format would
/// give a file that does not read back as it was meant. Throws std::bad_alloc.
std::optional<std::vector<NewLine>> MakeLines(std::string_view section, KAPICSzHash values,
                                              std::string_view line_format);

/// The new text of a file: what stays of the old text, and what comes between.
struct NewText {
    std::string_view before;
    std::string added;
    std::vector<std::string_view> after;
};

/// The text with a section of that name put at its end.
NewText WithSectionAdded(const SectionImage& image, std::string_view name,
                         const std::vector<NewLine>& lines);
/// The text with the first section of that name replaced, or one put at its end, and all others of
/// that name gone.
NewText WithSectionReplaced(const SectionImage& image, std::string_view name,
                            const std::vector<NewLine>& lines);
/// The text with the given keys of `section` set; its other lines stay as they are.
NewText WithKeysSet(const SectionImage& image, const Section& section,
                    const std::vector<NewLine>& lines);
/// The text with every section of that name gone. `section` is the first of them.
NewText WithSectionRemoved(const SectionImage& image, Section section);

}  // namespace tarqcore

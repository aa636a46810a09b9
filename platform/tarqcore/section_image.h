#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

namespace tarqcore {

/// A section's place in the text, in bytes from the start.
struct Section {
    uint32_t begin;      ///< of the header's line
    uint32_t name;       ///< of the name, behind the bracket
    uint32_t name_size;  ///< in bytes
    uint32_t end;        ///< of the next header's line, or of the text
};

/// The text of a section file and where its sections lie in it. Immutable: any number of threads
/// may look things up.
///
/// A header is "[name]" at the start of a line; blanks before it and anything behind the bracket do
/// not count. Of several sections of one name the first counts. A byte order mark in front of the
/// text is passed over.
class SectionImage {
public:
    /// `text` of `size` bytes, at most 4 GiB less one.
    SectionImage(std::unique_ptr<char[]> text, size_t size);
    SectionImage() : SectionImage(nullptr, 0) {}

    std::string_view Text() const { return {text_.get(), size_}; }
    std::string_view Name(const Section& section) const {
        return {text_.get() + section.name, section.name_size};
    }
    /// The lines behind the header's.
    std::string_view Body(const Section& section) const;

    /// The first section of that name. The first few calls scan the text; those that follow search
    /// an index.
    std::optional<Section> Find(std::string_view name) const;
    /// The first section of that name that begins at or behind `from`, found by a scan of the text.
    std::optional<Section> FindFrom(std::string_view name, size_t from) const;
    /// All sections in file order.
    const std::vector<Section>& Sections() const;

private:
    size_t LineBegin(size_t at) const;
    std::optional<Section> NextHeader(size_t from) const;
    size_t NextHeaderBegin(size_t from) const;
    const std::vector<uint32_t>& ByName() const;

    std::unique_ptr<char[]> text_;
    size_t size_;
    size_t first_;  // where the text begins behind a byte order mark

    mutable std::atomic<unsigned> scans_{0};
    mutable std::once_flag sections_once_;
    mutable std::vector<Section> sections_;
    mutable std::once_flag by_name_once_;
    mutable std::vector<uint32_t> by_name_;  // positions in sections_, by name and then by place
};

}  // namespace tarqcore

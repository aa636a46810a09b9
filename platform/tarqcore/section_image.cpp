#include "platform/tarqcore/section_image.h"

#include <algorithm>
#include <numeric>

#include "base/section_view.h"

namespace tarqcore {
namespace {

using base::kByteOrderMark;

constexpr size_t kNone = std::string_view::npos;

// Look-ups that scan before an index is made: it costs about as much as these together, and a
// process that asks for two or three keys and ends never needs it.
constexpr unsigned kScansBeforeIndex = 8;

bool IsBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r';
}

// On x86 with GCC the search below is compiled for wide vectors as well, and the loader picks. Not
// in instrumented builds: they cannot run the picking before their own start-up.
#if defined(__GNUC__) && !defined(__clang__) && (defined(__x86_64__) || defined(__i386__)) && \
    !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
#define TARQ_WIDE_VECTORS __attribute__((target_clones("avx2", "default")))
#else
#define TARQ_WIDE_VECTORS
#endif

/// Where `needle`, "[name]", next stands in `text`; kNone when it does not. Faster than memmem(),
/// whose skips are short among names that are alike: whole blocks are passed over in which no place
/// has the brackets at the right distance and the name's last character between them. The compiler
/// makes vector instructions of the inner loop.
TARQ_WIDE_VECTORS size_t FindBracketed(std::string_view text, std::string_view needle,
                                       size_t from) {
    constexpr size_t kBlock = 128;
    const size_t last = needle.size() - 1;
    const char before_last = needle[last - 1];
    for (; from + kBlock + last <= text.size(); from += kBlock) {
        const char* block = text.data() + from;
        unsigned char any = 0;
        for (size_t i = 0; i < kBlock; ++i) {
            any |= static_cast<unsigned char>((block[i] == '[') & (block[i + last] == ']') &
                                              (block[i + last - 1] == before_last));
        }
        if (any != 0) {
            const size_t at = text.substr(from, kBlock + last).find(needle);
            if (at != kNone) {
                return from + at;
            }
        }
    }
    return text.find(needle, from);
}

}  // namespace

SectionImage::SectionImage(std::unique_ptr<char[]> text, size_t size)
    : text_(std::move(text)), size_(size) {
    const bool marked = Text().substr(0, kByteOrderMark.size()) == kByteOrderMark;
    first_ = marked ? kByteOrderMark.size() : 0;
}

std::string_view SectionImage::Body(const Section& section) const {
    std::string_view body = Text().substr(section.begin, section.end - section.begin);
    std::string_view header;
    base::TakeLine(body, header);
    return body;
}

std::optional<Section> SectionImage::Find(std::string_view name) const {
    if (scans_.load(std::memory_order_relaxed) < kScansBeforeIndex) {
        scans_.fetch_add(1, std::memory_order_relaxed);
        return FindFrom(name, 0);
    }
    const std::vector<uint32_t>& by_name = ByName();
    const auto found = std::lower_bound(
        by_name.begin(), by_name.end(), name,
        [this](uint32_t at, std::string_view wanted) { return Name(sections_[at]) < wanted; });
    if (found == by_name.end() || Name(sections_[*found]) != name) {
        return std::nullopt;
    }
    return sections_[*found];
}

std::optional<Section> SectionImage::FindFrom(std::string_view name, size_t from) const {
    if (name.find_first_of(std::string_view("]\n\0", 3)) != kNone) {
        return std::nullopt;  // no header can say that
    }
    std::string needle = "[";
    needle.append(name).append("]");
    for (size_t at = FindBracketed(Text(), needle, std::max(from, first_)); at != kNone;
         at = FindBracketed(Text(), needle, at + 1)) {
        const size_t begin = LineBegin(at);
        if (begin != kNone) {
            return Section{static_cast<uint32_t>(begin), static_cast<uint32_t>(at + 1),
                           static_cast<uint32_t>(name.size()),
                           static_cast<uint32_t>(NextHeaderBegin(at + needle.size()))};
        }
    }
    return std::nullopt;
}

const std::vector<Section>& SectionImage::Sections() const {
    std::call_once(sections_once_, [this] {
        std::vector<Section> sections;
        for (std::optional<Section> header = NextHeader(first_); header;
             header = NextHeader(header->name + header->name_size)) {
            if (!sections.empty()) {
                sections.back().end = header->begin;
            }
            sections.push_back(*header);
        }
        sections_ = std::move(sections);
    });
    return sections_;
}

// Where the line begins whose first character but blanks is at `at`; kNone when others stand before
// it.
size_t SectionImage::LineBegin(size_t at) const {
    while (at > first_ && IsBlank(text_[at - 1])) {
        --at;
    }
    return at == first_ || text_[at - 1] == '\n' ? at : kNone;
}

// The first header at or behind `from`, as if its section ran to the end of the text. Goes from
// bracket to bracket rather than from line to line. Each byte is looked at a bounded number of
// times, whatever the text: the search back stops at the bracket before, the search for the name's
// end at the line's.
std::optional<Section> SectionImage::NextHeader(size_t from) const {
    const std::string_view text = Text();
    for (size_t at = text.find('[', from); at != kNone; at = text.find('[', at + 1)) {
        const size_t begin = LineBegin(at);
        if (begin == kNone) {
            continue;
        }
        const std::string_view rest = text.substr(at + 1);
        const std::string_view line = rest.substr(0, rest.find('\n'));
        const size_t name_size = line.find(']');
        if (name_size != kNone && line.substr(0, name_size).find('\0') == kNone) {
            return Section{static_cast<uint32_t>(begin), static_cast<uint32_t>(at + 1),
                           static_cast<uint32_t>(name_size), static_cast<uint32_t>(size_)};
        }
    }
    return std::nullopt;
}

size_t SectionImage::NextHeaderBegin(size_t from) const {
    const std::optional<Section> next = NextHeader(from);
    return next ? next->begin : size_;
}

const std::vector<uint32_t>& SectionImage::ByName() const {
    std::call_once(by_name_once_, [this] {
        const std::vector<Section>& sections = Sections();
        std::vector<uint32_t> by_name(sections.size());
        std::iota(by_name.begin(), by_name.end(), 0U);
        std::sort(by_name.begin(), by_name.end(), [&](uint32_t a, uint32_t b) {
            const int order = Name(sections[a]).compare(Name(sections[b]));
            return order != 0 ? order < 0 : a < b;
        });
        by_name_ = std::move(by_name);
    });
    return by_name_;
}

}  // namespace tarqcore

// Section files from anywhere: the scan and the index find the same, and what was read can be
// written back, reads back the same and leaves all other sections as they were.
//
//   build/fuzz/bin/section_file_fuzz fuzz/corpus/section_file
#include <cstdint>
#include <cstring>
#include <map>
#include <memory>

#include "base/section_view.h"
#include "fuzz/require.h"
#include "platform/tarqcore/section_edit.h"
#include "platform/tarqcore/section_image.h"
#include "tests/support/string_hash.h"

namespace {

using tarqcore::NewText;
using tarqcore::Section;
using tarqcore::SectionImage;

constexpr size_t kSectionsWritten = 16;

using Values = std::map<std::string, std::string>;

std::unique_ptr<SectionImage> MakeImage(std::string_view text) {
    std::unique_ptr<char[]> copy(new char[text.size()]);
    memcpy(copy.get(), text.data(), text.size());
    return std::make_unique<SectionImage>(std::move(copy), text.size());
}

Values ReadValues(const SectionImage& image, const Section& section) {
    Values values;
    std::string_view body = image.Body(section);
    for (std::string_view line; base::TakeLine(body, line);) {
        if (const auto entry = base::ParseKeyLine(line)) {
            values.emplace(entry->key, entry->value);  // of two lines of one key the first counts
        }
    }
    return values;
}

/// All sections by name, the first of each.
std::map<std::string, Values> ReadAll(const SectionImage& image) {
    std::map<std::string, Values> all;
    for (const Section& section : image.Sections()) {
        all.emplace(image.Name(section), ReadValues(image, section));
    }
    return all;
}

std::unique_ptr<SectionImage> Apply(const NewText& change) {
    std::string text(change.before);
    text += change.added;
    for (const std::string_view piece : change.after) {
        text += piece;
    }
    return MakeImage(text);
}

void CheckWritesBack(const SectionImage& image, const std::map<std::string, Values>& all,
                     const std::string& name) {
    const test::Hash hash;
    for (const auto& [key, value] : all.at(name)) {
        KAPICSzHashSetValue(hash, key.c_str(), value.c_str());
    }
    const auto lines = tarqcore::MakeLines(name, hash, "\t%s=\"%s\"\n");
    if (!lines) {
        return;  // it holds a carriage return or the like: read as it stands, never written
    }
    Require(ReadAll(*Apply(tarqcore::WithSectionReplaced(image, name, *lines))) == all);
    const Section section = *image.Find(name);
    Require(ReadAll(*Apply(tarqcore::WithKeysSet(image, section, *lines))) == all);
    Require(ReadAll(*Apply(tarqcore::WithSectionAdded(image, name, *lines))) == all);
    std::map<std::string, Values> others = all;
    others.erase(name);
    Require(ReadAll(*Apply(tarqcore::WithSectionRemoved(image, section))) == others);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    const auto image = MakeImage({reinterpret_cast<const char*>(data), size});
    const std::map<std::string, Values> all = ReadAll(*image);
    size_t written = 0;
    for (const auto& [name, values] : all) {
        const auto found = image->Find(name);  // by scan for the first few, then by index
        const auto scanned = image->FindFrom(name, 0);
        Require(found && scanned && found->begin == scanned->begin && found->end == scanned->end);
        if (++written <= kSectionsWritten) {
            CheckWritesBack(*image, all, name);
        }
    }
    return 0;
}

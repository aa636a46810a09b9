#include <string.h>
#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <string>
#include <string_view>
#include <vector>

#include "base/replace_file.h"
#include "base/section_view.h"
#include "platform/internal/error.h"
#include "platform/tarqcore/section_edit.h"
#include "platform/tarqcore/section_image.h"
#include "platform/tarqcore/section_source.h"

using base::KeyLine;
using tarq_internal::Fail;
using tarq_internal::Guarded;
using tarqcore::FileToUpdate;
using tarqcore::NewLine;
using tarqcore::NewText;
using tarqcore::Section;
using tarqcore::SectionImage;

namespace {

constexpr const char* kDefaultLineFormat = "%s=\"%s\"\n";

/// 1, or -1 with the error code set.
int Write(const FileToUpdate& file, const NewText& text) {
    std::vector<std::string_view> pieces{text.before, text.added};
    pieces.insert(pieces.end(), text.after.begin(), text.after.end());
    size_t size = 0;
    for (const std::string_view piece : pieces) {
        size += piece.size();
    }
    if (size > tarqcore::kMaxFileBytes) {  // it could not be read again
        errno = EFBIG;
        return Fail(TARQ_ERR_WRITE_FILE);
    }
    const struct stat* old = file.status ? &*file.status : nullptr;
    return base::ReplaceFile(file.path, pieces, old) ? 1 : Fail(TARQ_ERR_WRITE_FILE);
}

/// The shape of every write: check what is to be written, read the file, edit, write. `edit` is
/// called with the file and the lines; its result is the operation's.
template <typename Edit>
int Update(const char* path, const char* section, KAPICSzHash values, const char* line_format,
           Edit&& edit) {
    if (path == nullptr || section == nullptr || values == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    return Guarded(-1, [&] {
        const std::optional<std::vector<NewLine>> lines = tarqcore::MakeLines(
            section, values, line_format != nullptr ? line_format : kDefaultLineFormat);
        if (!lines) {
            return Fail(TARQ_ERR_BAD_PARAMETER);
        }
        const std::optional<FileToUpdate> file = tarqcore::ReadForUpdate(path);
        return file ? edit(*file, *lines) : -1;
    });
}

}  // namespace

int KAPICFileExist(const char* path) {
    struct stat status {};
    return path != nullptr && stat(path, &status) == 0 ? 1 : 0;
}

int KAPICFileGetSection(const char* path, const char* section, KAPICSzHash into) {
    if (path == nullptr || section == nullptr || into == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    return Guarded(-1, [&] {
        const auto image = tarqcore::ReadSections(path);
        if (image == nullptr) {
            return -1;
        }
        const std::optional<Section> found = image->Find(section);
        if (!found) {
            return 0;
        }
        std::vector<KeyLine> entries;
        std::string_view body = image->Body(*found);
        for (std::string_view line; base::TakeLine(body, line);) {
            if (const std::optional<KeyLine> entry = base::ParseKeyLine(line)) {
                entries.push_back(*entry);
            }
        }
        // From the last to the first: of two lines of one key the first counts.
        std::string key;
        std::string value;
        for (auto entry = entries.rbegin(); entry != entries.rend(); ++entry) {
            key = entry->key;
            value = entry->value;
            if (KAPICSzHashSetValue(into, key.c_str(), value.c_str()) != 0) {
                return -1;
            }
        }
        return 1;
    });
}

int KAPICFileGetSectionValue(const char* path, const char* section, const char* key, char* buffer,
                             int size) {
    if (path == nullptr || section == nullptr || key == nullptr || buffer == nullptr || size <= 0) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    return Guarded(-1, [&] {
        const auto image = tarqcore::ReadSections(path);
        if (image == nullptr) {
            return -1;
        }
        const std::optional<Section> found = image->Find(section);
        if (!found) {
            return Fail(TARQ_ERR_NO_SECTION);
        }
        std::string_view body = image->Body(*found);
        for (std::string_view line; base::TakeLine(body, line);) {
            const std::optional<KeyLine> entry = base::ParseKeyLine(line);
            if (entry && entry->key == key) {
                const size_t n = entry->value.copy(buffer, static_cast<size_t>(size) - 1);
                buffer[n] = '\0';
                return 0;
            }
        }
        return Fail(TARQ_ERR_NO_KEY);
    });
}

int KAPICFileSetSection(const char* path, const char* section, int, KAPICSzHash values,
                        const char* line_format) {
    return Update(path, section, values, line_format,
                  [&](const FileToUpdate& file, const std::vector<NewLine>& lines) {
                      return Write(file, WithSectionReplaced(*file.image, section, lines));
                  });
}

int KAPICFileAddSection(const char* path, const char* section, KAPICSzHash values,
                        const char* line_format) {
    return Update(path, section, values, line_format,
                  [&](const FileToUpdate& file, const std::vector<NewLine>& lines) {
                      return Write(file, WithSectionAdded(*file.image, section, lines));
                  });
}

int KAPICIFileModifySection(const char* path, const char* section, int, KAPICSzHash values, int,
                            int) {
    return Update(path, section, values, nullptr,
                  [&](const FileToUpdate& file, const std::vector<NewLine>& lines) {
                      const std::optional<Section> found = file.image->FindFrom(section, 0);
                      return found ? Write(file, WithKeysSet(*file.image, *found, lines)) : 0;
                  });
}

int KAPICFileRemoveSection(const char* path, const char* section) {
    if (path == nullptr || section == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    return Guarded(-1, [&] {
        const std::optional<FileToUpdate> file = tarqcore::ReadForUpdate(path);
        if (!file) {
            return -1;
        }
        const std::optional<Section> found = file->image->FindFrom(section, 0);
        return found ? Write(*file, WithSectionRemoved(*file->image, *found)) : 0;
    });
}

int KAPICFileEnumSection(const char* path, KAPICSzList into) {
    if (path == nullptr || into == nullptr) {
        return Fail(TARQ_ERR_BAD_PARAMETER);
    }
    return Guarded(-1, [&] {
        const auto image = tarqcore::ReadSections(path);
        if (image == nullptr) {
            return -1;
        }
        std::string name;
        for (const Section& section : image->Sections()) {
            name = image->Name(section);
            if (KAPICSzListPush(into, name.c_str()) != 0) {
                return -1;
            }
        }
        return static_cast<int>(image->Sections().size());
    });
}

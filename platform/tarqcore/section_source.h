#pragma once

#include <sys/stat.h>

#include <memory>
#include <optional>
#include <string>

#include "platform/tarqcore/section_image.h"

namespace tarqcore {

/// The largest section file that is read or written, so that neither a damaged nor a hostile file
/// takes the machine's memory: room for some 80,000 sections. A larger one is a failure with errno
/// EFBIG.
constexpr size_t kMaxFileBytes = 8U << 20;

/// The file's sections as they are now, from memory when the file is known to be unchanged. An
/// image without sections when the file does not exist; null on failure (the error code is set).
/// Throws std::bad_alloc.
std::shared_ptr<const SectionImage> ReadSections(const char* path);

/// A section file on its way to be written.
struct FileToUpdate {
    std::string path;                   ///< the file itself, behind all symbolic links
    std::optional<struct stat> status;  ///< none: the file does not exist
    std::unique_ptr<SectionImage> image;
};

/// Reads the file, always from disk. Nothing on failure (the error code is set). Throws
/// std::bad_alloc.
std::optional<FileToUpdate> ReadForUpdate(const char* path);

}  // namespace tarqcore

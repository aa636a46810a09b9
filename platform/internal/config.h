// Reading configuration, reporting failures and answering in callers' buffers: what every operation
// of the platform's small libraries does in the same way. Uses the operations of tarq/core.h, so a
// library that uses this links tarqcore.
#pragma once

#include <map>
#include <string>

namespace tarq_internal {

using Section = std::map<std::string, std::string>;

enum class ReadResult { kFound, kAbsent, kFailed };

/// Reads a section of a section file. A file that does not exist has none. kFailed leaves the error
/// code set.
ReadResult ReadSection(const std::string& path, const std::string& section, Section* values);

/// Reads one value of a section file, whole.
ReadResult ReadValue(const std::string& path, const std::string& section, const std::string& key,
                     std::string* value);

/// The value of `key`; empty when the section has none.
std::string ValueOf(const Section& section, const std::string& key);

/// Writes `text` and its terminator into `buffer`. False, with an empty string in the buffer when
/// there is one, when it does not fit: nothing is ever cut off.
bool CopyOut(const std::string& text, char* buffer, int size);

}  // namespace tarq_internal
